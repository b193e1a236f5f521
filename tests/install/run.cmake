# Installs the built library and programs into a scratch prefix, builds the
# consumer project against it and runs both consumer programs and every
# installed program, with no LD_LIBRARY_PATH: the run paths must suffice.
file(REMOVE_RECURSE ${WORK_DIR})
set(prefix ${WORK_DIR}/prefix)

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "failed (${rc}): ${ARGN}")
  endif()
endfunction()

run(${CMAKE_COMMAND} --install ${S2S_BINARY_DIR} --prefix ${prefix})
set(ENV{PKG_CONFIG_PATH} ${prefix}/${LIBDIR}/pkgconfig)
run(${CMAKE_COMMAND} -S ${S2S_CONSUMER_DIR} -B ${WORK_DIR}/build
    -G ${GENERATOR} -DCMAKE_PREFIX_PATH=${prefix})
run(${CMAKE_COMMAND} --build ${WORK_DIR}/build)
unset(ENV{LD_LIBRARY_PATH})
run(${WORK_DIR}/build/consumer_cmake)
run(${WORK_DIR}/build/consumer_pkgconfig)
file(GLOB programs ${prefix}/bin/* ${prefix}/sbin/*)
foreach(program ${programs})
  run(${program} --version)
endforeach()
# The library starts the client service from the prefix's programs.
set(ENV{S2S_ROOT} ${WORK_DIR}/root)
run(${WORK_DIR}/build/consumer_cmake service)
