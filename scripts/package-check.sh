#!/usr/bin/env bash
# The Debian package end to end (run as root on a Debian 12 machine that ran
# scripts/setup.sh): builds it with CPack, lints it with lintian, installs it
# with apt-get, runs the demo against the installed programs, removes it and
# shows that only its configuration is left, then purges it and shows that
# nothing is left.
#
#   bash scripts/package-check.sh      (BUILD_DIR, default build-deb)
set -euo pipefail

top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
cd "$top"
dir=${BUILD_DIR:-build-deb}
step() { printf '\n== package: %s\n' "$*"; }

if [ "$(id -u)" -ne 0 ]; then
  echo "package-check: installing the package needs root" >&2
  exit 1
fi
if dpkg-query -W -f='${Status}' s2s 2>/dev/null | grep -q installed; then
  echo "package-check: the package s2s is installed already; remove it first" >&2
  exit 1
fi

step "build"
cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_INSTALL_PREFIX=/usr -DS2S_INSTALL_SYSTEM_FILES=ON \
  -DS2S_BUILD_TESTS=OFF -DS2S_BUILD_BENCHMARKS=OFF -DS2S_SANITIZE= >/dev/null
cmake --build "$dir" -j "$(nproc)"
rm -f "$dir"/s2s_*.deb
(cd "$dir" && cpack -G DEB >/dev/null)
deb=$(ls "$top/$dir"/s2s_*.deb)
dpkg-deb --info "$deb" | sed -n '/Package:/,$p'

step "lintian $(basename "$deb")"
lintian --fail-on error "$deb"
echo "lintian: no errors"

step "install"
trap 'apt-get purge -y -qq s2s >/dev/null 2>&1 || true' EXIT
DEBIAN_FRONTEND=noninteractive apt-get install -y -qq "$deb" >/dev/null
dpkg-query -W -f='${Package} ${Version} ${Status}\n' s2s
mapfile -t files < <(dpkg -L s2s)
mapfile -t conffiles < <(dpkg-query -W -f='${Conffiles}\n' s2s |
  awk 'NF { print $1 }')
for p in s2s-client s2s-server s2s-cmd-handler s2sctl s2sd; do
  [ -x "/usr/bin/$p" ] || [ -x "/usr/sbin/$p" ] || continue
  "$p" --version
done
man -w s2s-server s2s-client s2s-task >/dev/null
echo "manual pages: $(man -w s2s-server s2s-client s2s-task | tr '\n' ' ')"

step "demo against the installed programs"
command -v s2s-client s2s-server s2s-cmd-handler
bash tools/demo.sh --installed

step "remove"
DEBIAN_FRONTEND=noninteractive apt-get remove -y -qq s2s >/dev/null
dpkg-query -W -f='${Package}: ${Status}\n' s2s
left=0
for f in "${files[@]}"; do
  [ -e "$f" ] && [ ! -d "$f" ] || continue
  keep=0
  for c in "${conffiles[@]}"; do [ "$f" = "$c" ] && keep=1; done
  if [ $keep -eq 0 ]; then
    echo "left after remove: $f" >&2
    left=1
  fi
done
[ $left -eq 0 ]
echo "left after remove (configuration only):"
for c in "${conffiles[@]}"; do [ -e "$c" ] && echo "  $c"; done

step "purge"
DEBIAN_FRONTEND=noninteractive apt-get purge -y -qq s2s >/dev/null
trap - EXIT
if dpkg-query -W s2s >/dev/null 2>&1; then
  echo "package-check: s2s still known to dpkg after purge" >&2
  exit 1
fi
for f in "${files[@]}" /etc/s2s; do
  [ -e "$f" ] && [ ! -d "$f" ] && { echo "left after purge: $f" >&2; exit 1; }
done
[ ! -e /etc/s2s ] || { echo "left after purge: /etc/s2s" >&2; exit 1; }
echo "package-check: OK"
