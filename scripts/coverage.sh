#!/usr/bin/env bash
# Line coverage of the code by the test suite, per folder, and the size of the
# tests against the code.
#
#   bash scripts/coverage.sh            configure, build, run ctest, report
#   bash scripts/coverage.sh report     report from the last run only
#
# BUILD_DIR (default build-cov) is a plain build of its own with gcc's
# --coverage; CTEST_ARGS are passed to ctest (for example "-R stream").
#
# lcov reads the counters: it is a Debian 12 package (lcov 1.16) that needs
# nothing but Perl and gcc's own gcov, and it counts lines the way the
# project's earlier figures were counted, so the figures stay comparable.
# It is installed here when missing (root only).
set -euo pipefail

job=${1:-all}
top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
cd "$top"
dir=${BUILD_DIR:-build-cov}
folders=(S2S platform rsyncwrapper server service tools)

if ! command -v lcov >/dev/null; then
  if [ "$(id -u)" -ne 0 ]; then
    echo "coverage: lcov is missing and only root can install it" >&2
    exit 1
  fi
  echo "coverage: installing lcov"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends lcov
fi

# geninfo 1.16 warns about its own redefined subroutines under newer Perl.
quiet_lcov() {
  lcov --quiet "$@" 2> >(grep -v 'redefined at' >&2)
}

launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache
            -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi

if [ "$job" = all ]; then
  # -O0: optimised code folds lines together and the counts stop matching
  # the source.
  cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=Debug \
    -DCMAKE_C_COMPILER=gcc -DCMAKE_CXX_COMPILER=g++ "${launcher[@]}" \
    -DCMAKE_C_FLAGS=--coverage -DCMAKE_CXX_FLAGS=--coverage \
    -DCMAKE_EXE_LINKER_FLAGS=--coverage \
    -DCMAKE_SHARED_LINKER_FLAGS=--coverage \
    -DS2S_BUILD_TESTS=ON -DS2S_BUILD_BENCHMARKS=OFF -DS2S_SANITIZE= >/dev/null
  cmake --build "$dir" -j "$(nproc)"
  quiet_lcov --zerocounters --directory "$dir"
  # The zero baseline lists every compiled line, so a file no test runs
  # counts as uncovered instead of vanishing from the total.
  quiet_lcov --capture --initial --directory "$dir" \
    --output-file "$dir/coverage-base.info"
  # ctest's status is kept: a failing test still leaves counters to read.
  status=0
  # shellcheck disable=SC2086
  ctest --test-dir "$dir" -j "$(nproc)" --output-on-failure \
    ${CTEST_ARGS:-} || status=$?
  quiet_lcov --capture --directory "$dir" \
    --output-file "$dir/coverage-run.info"
  quiet_lcov --add-tracefile "$dir/coverage-base.info" \
    --add-tracefile "$dir/coverage-run.info" \
    --output-file "$dir/coverage.info"
else
  status=0
fi

if [ ! -f "$dir/coverage.info" ]; then
  echo "coverage: no $dir/coverage.info; run without 'report' first" >&2
  exit 1
fi

# Lines found (LF) and hit (LH) per source file, summed per top folder.
awk -v top="$top/" -v list="${folders[*]}" '
  BEGIN { n = split(list, names, " ") }
  /^SF:/ { file = substr($0, 4); folder = "" }
  /^SF:/ && index(file, top) == 1 {
    rest = substr(file, length(top) + 1)
    folder = substr(rest, 1, index(rest, "/") - 1)
  }
  /^LF:/ && folder != "" { found[folder] += substr($0, 4) }
  /^LH:/ && folder != "" { hit[folder] += substr($0, 4) }
  END {
    printf "%-14s %8s %8s %8s\n", "folder", "lines", "hit", "cover"
    for (i = 1; i <= n; i++) {
      f = names[i]
      if (!(f in found)) continue
      printf "%-14s %8d %8d %7.1f%%\n", f "/", found[f], hit[f],
             found[f] ? 100 * hit[f] / found[f] : 0
      all_found += found[f]; all_hit += hit[f]
    }
    printf "%-14s %8d %8d %7.1f%%\n", "overall", all_found, all_hit,
           all_found ? 100 * all_hit / all_found : 0
  }' "$dir/coverage.info"

# Non-blank lines of C and C++ sources.
count() {
  find "$@" -type f \( -name '*.c' -o -name '*.cc' -o -name '*.h' \) \
    -exec cat {} + 2>/dev/null | grep -cv '^[[:space:]]*$'
}
tests=$(count tests fuzz)
code=$(count S2S include platform rsyncwrapper server service tools)
awk -v t="$tests" -v c="$code" 'BEGIN {
  printf "test lines %d, code lines %d, ratio %.2f\n", t, c, t / c }'
exit "$status"
