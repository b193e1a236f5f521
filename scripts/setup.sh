#!/usr/bin/env bash
# Set-up for a fresh Debian 12 machine (run as root): installs the Debian
# packages S2S needs (only those missing), configures and builds, then runs
# the requested job.
#
#   bash scripts/setup.sh demo     build and run the demo (tools/demo.sh):
#                                  a client and a server appliance on this
#                                  machine, a sync between them, checked
#   bash scripts/setup.sh test     build and run the test suite
#   bash scripts/setup.sh build    build only
#
# S2S_SANITIZE=address,undefined (or thread) builds into build-<name> with
# those sanitizers; BUILD_DIR overrides the build directory.
set -euo pipefail

job=${1:-test}
top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
cd "$top"

packages=(
  g++ cmake ninja-build pkg-config
  libssl-dev openssl libboost-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  rsync openssh-server openssh-client samba-common-bin acl tzdata
  scdoc man-db lintian
  clang libclang-rt-14-dev
  lcov  # scripts/coverage.sh
)

install_missing() {
  local missing=()
  local p
  for p in "${packages[@]}"; do
    if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "ok installed"; then
      missing+=("$p")
    fi
  done
  if [ ${#missing[@]} -eq 0 ]; then
    return
  fi
  echo "setup: installing ${missing[*]}"
  if [ "$(id -u)" -ne 0 ]; then
    echo "setup: these packages are missing and only root can install them" >&2
    exit 1
  fi
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}"
}

configure_and_build() {
  local sanitize=${S2S_SANITIZE:-}
  local dir=${BUILD_DIR:-build}
  local benches=ON
  if [ -n "$sanitize" ]; then
    dir=${BUILD_DIR:-build-${sanitize//,/-}}
    benches=OFF
  fi
  BUILD=$dir
  cmake -S . -B "$dir" -G Ninja \
    -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DS2S_BUILD_TESTS=ON \
    -DS2S_BUILD_BENCHMARKS=$benches \
    -DS2S_SANITIZE="$sanitize" >/dev/null
  # The demo needs only the programs.
  local targets=()
  if [ "$job" = demo ]; then
    targets=(--target s2s-client s2s-server s2s-cmd-handler s2sd s2sctl)
  fi
  cmake --build "$dir" -j "$(nproc)" "${targets[@]}"
}

install_missing
configure_and_build
case "$job" in
  build) ;;
  demo)
    bash tools/demo.sh "$BUILD"
    ;;
  test)
    # Most cases wait on daemons, the disk and timers rather than compute:
    # two per core keep the cores busy. The sanitizer build computes far
    # more, so it runs one per core.
    jobs=$(($(nproc) * 2))
    [ -z "${S2S_SANITIZE:-}" ] || jobs=$(nproc)
    ctest --test-dir "$BUILD" --output-on-failure -j "$jobs" --timeout 300
    ;;
  *)
    echo "usage: bash scripts/setup.sh [demo|test|build]" >&2
    exit 2
    ;;
esac
