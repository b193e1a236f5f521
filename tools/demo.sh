#!/usr/bin/env bash
# The S2S demo: a client and a server appliance on this machine, under one
# temporary directory. The server's rsync daemon runs on 127.0.0.1 at a free
# port; the client syncs three shares of sample data to it, changes them and
# syncs again; each copy is checked with diff -r. Everything started here is
# stopped by its own pid file and the directory is removed, also on failure.
#
#   tools/demo.sh [BUILD_DIR]     (default: build/ beside tools/)
#   tools/demo.sh --installed     the installed programs, found along PATH
set -euo pipefail

top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
if [ "${1:-}" = --installed ]; then
  PATH=$PATH:/usr/sbin:/sbin
  client_bin=$(command -v s2s-client || echo "s2s-client (installed)")
  server_bin=$(command -v s2s-server || echo "s2s-server (installed)")
  handler_bin=$(command -v s2s-cmd-handler || echo "s2s-cmd-handler")
else
  bin=$(cd "${1:-${S2S_BUILD_DIR:-$top/build}}" && pwd)
  client_bin=$bin/s2s-client
  server_bin=$bin/s2s-server
  handler_bin=$bin/s2s-cmd-handler
fi
for p in "$client_bin" "$server_bin" "$handler_bin"; do
  [ -x "$p" ] || { echo "demo: $p is missing; build first" >&2; exit 1; }
done

work=$(mktemp -d "${TMPDIR:-/tmp}/s2s-demo.XXXXXX")
server=$work/server
client=$work/client
cleanup() {
  "$server_bin" --root "$server" stop >/dev/null 2>&1 || true
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

step() { printf '\n== %s\n' "$*"; }
unset S2S_ROOT S2S_PASSWORD

step "server appliance in $server"
# The daemon password lives only in a private file.
(umask 077 && head -c 24 /dev/urandom | base64 | tr -d '/+=' >"$work/password")
"$server_bin" --root "$server" init --hostname backup1 --serial DEMO-SERVER \
  --share docs --share photos --share projects \
  --user s2s --password-file "$work/password"
started=$("$server_bin" --root "$server" start)
echo "$started"
port=$(sed -n 's/^daemon: pid [0-9]*, port \([0-9]*\)$/\1/p' <<<"$started")
[ -n "$port" ] || { echo "demo: no daemon port" >&2; exit 1; }

step "client appliance in $client"
"$client_bin" --root "$client" init --serial DEMO-CLIENT-1 --hostname office1 \
  --share docs --share photos --share projects
# Sample data: small trees with text, binary data, an empty directory, a
# symbolic link and a hard link.
d=$client/volume1
mkdir -p "$d/docs/reports/2026" "$d/docs/empty" "$d/photos/trip" \
  "$d/projects/s2s/src" "$d/projects/s2s/doc"
for i in 1 2 3 4 5; do
  echo "Quarterly report $i" >"$d/docs/reports/2026/q$i.txt"
  head -c $((i * 40000)) /dev/urandom >"$d/photos/trip/img_$i.raw"
  printf 'int f%d(void) { return %d; }\n' "$i" "$i" >"$d/projects/s2s/src/f$i.c"
done
echo "Read me first." >"$d/docs/README"
echo "design notes" >"$d/projects/s2s/doc/notes.md"
ln -s reports/2026/q5.txt "$d/docs/latest-report"
ln "$d/docs/README" "$d/docs/README.txt"
echo "client shares:"
for share in docs photos projects; do
  printf '  %-9s %3d files, %s\n' "$share" \
    "$(find "$d/$share" -type f | wc -l)" "$(du -sh "$d/$share" | cut -f1)"
done

task=$client/etc/s2s/demo.task
cat >"$task" <<CONF
[Task]
	name="demo"
	server_ip="127.0.0.1"
	port="$port"
	user="s2s"
	password_file="$work/password"
	shares="docs:photos:projects"
CONF
echo "task file $task:"
sed 's/^/  /' "$task"

verify() {
  local share ok=0
  for share in docs photos projects; do
    if diff -r --no-dereference "$client/volume1/$share" \
      "$server/volume1/$share" >"$work/diff.txt"; then
      echo "  $share: identical"
    else
      echo "  $share: DIFFERS" && sed 's/^/    /' "$work/diff.txt" && ok=1
    fi
  done
  return $ok
}

step "first sync: s2s-client --root $client --task-file $task"
"$client_bin" --root "$client" --task-file "$task"

step "server status"
"$server_bin" --root "$server" status

step "verify the copy"
verify

step "change the client's data and sync again"
rm "$d/photos/trip/img_2.raw"
echo "Quarterly report 6" >"$d/docs/reports/2026/q6.txt"
echo "int main(void) { return 0; }" >"$d/projects/s2s/src/main.c"
"$client_bin" --root "$client" --task-file "$task"
verify

step "pairing registry of the server"
"$server_bin" --root "$server" pairings

step "stop the server's daemon"
"$server_bin" --root "$server" stop
echo
echo "demo: OK"
