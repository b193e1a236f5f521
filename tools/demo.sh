#!/usr/bin/env bash
# The S2S demo: a client and a server appliance on this machine, under one
# temporary directory. The server's rsync daemon runs on 127.0.0.1 at a free
# port; the client syncs three shares of sample data to it, changes them and
# syncs again; each copy is checked with diff -r. Then the client service
# s2sd runs on the client root: a task added with s2sctl runs by itself at
# the next full minute, another is run on demand, a realtime task pushes
# each change within seconds, and status and history show what happened. Everything started here is stopped by its own pid and
# the directory is removed, also on failure.
#
#   tools/demo.sh [BUILD_DIR]     (default: build/ beside tools/)
#   tools/demo.sh --installed     the installed programs, found along PATH
#
# With S2S_DEMO_QUICK=1 (the test suite) s2sd's schedules see a clock moved
# so that the scheduled minute comes within seconds instead of a minute.
set -euo pipefail

top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
if [ "${1:-}" = --installed ]; then
  PATH=$PATH:/usr/sbin:/sbin
  client_bin=$(command -v s2s-client || echo "s2s-client (installed)")
  server_bin=$(command -v s2s-server || echo "s2s-server (installed)")
  handler_bin=$(command -v s2s-cmd-handler || echo "s2s-cmd-handler")
  s2sd_bin=$(command -v s2sd || echo "s2sd (installed)")
  ctl_bin=$(command -v s2sctl || echo "s2sctl (installed)")
else
  bin=$(cd "${1:-${S2S_BUILD_DIR:-$top/build}}" && pwd)
  client_bin=$bin/s2s-client
  server_bin=$bin/s2s-server
  handler_bin=$bin/s2s-cmd-handler
  s2sd_bin=$bin/s2sd
  ctl_bin=$bin/s2sctl
fi
for p in "$client_bin" "$server_bin" "$handler_bin" "$s2sd_bin" "$ctl_bin"; do
  [ -x "$p" ] || { echo "demo: $p is missing; build first" >&2; exit 1; }
done

work=$(mktemp -d "${TMPDIR:-/tmp}/s2s-demo.XXXXXX")
server=$work/server
client=$work/client
s2sd_pid=
cleanup() {
  if [ -n "$s2sd_pid" ]; then
    kill -TERM "$s2sd_pid" 2>/dev/null || true
    wait "$s2sd_pid" 2>/dev/null || true
  fi
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

# The client service. s2sd stays in the foreground (as a unit runs it); here
# it runs in the background of this script, which stops it by its pid. It
# reaches the server's daemon at the port in its environment.
ctl() { "$ctl_bin" --root "$client" "$@"; }
step "the client service: s2sd --foreground --root $client"
offset=0 spare=10
if [ -n "${S2S_DEMO_QUICK:-}" ]; then
  now=$(date +%s)
  offset=$(((now / 60 + 1) * 60 - 3 - now)) spare=2
fi
S2S_RSYNC_PORT=$port "$s2sd_bin" --foreground --root "$client" \
  --log "$work/s2sd.log" --clock-offset "$offset" &
s2sd_pid=$!
for _ in $(seq 100); do
  ctl status >/dev/null 2>&1 && break
  kill -0 "$s2sd_pid" 2>/dev/null || { cat "$work/s2sd.log" >&2; exit 1; }
  sleep 0.1
done
ctl status

# Waits until the task's newest run has ended (at most $2 seconds) and
# shows its history; fails unless that run went well.
await_run() {
  local task=$1 limit=$2 json
  for _ in $(seq $((limit * 5))); do
    json=$(ctl --json history "$task" --limit 1)
    if grep -q '"outcome": "\(ok\|failed\|cancelled\)"' <<<"$json"; then
      ctl history "$task"
      grep -q '"outcome": "ok"' <<<"$json" && return 0
      cat "$work/s2sd.log" >&2
      return 1
    fi
    sleep 0.2
  done
  echo "demo: $task did not run within $limit s" >&2
  cat "$work/s2sd.log" >&2
  return 1
}

# Daily at the next full minute of s2sd's clock (with some seconds to
# spare), so that it fires by itself while the demo watches.
now=$(($(date +%s) + offset))
next=$(((now / 60 + 1) * 60))
[ $((next - now)) -ge $spare ] || next=$((next + 60))
at=$(date -d "@$next" +%H:%M)
step "a task that runs by itself, daily at $at"
echo "Written while the service waits." >"$d/docs/from-the-service.txt"
ctl task add --task nightly --server-ip 127.0.0.1 --user s2s \
  --password-file "$work/password" --share docs --share photos \
  --share projects --schedule weekly --days daily --at "$at"
ctl task list
echo "waiting for $at ($((next - $(date +%s) - offset)) s) ..."
await_run nightly $((next - now + 60))
verify

step "a manual task, run on demand: s2sctl run on-demand"
echo "int g(void) { return 7; }" >"$d/projects/s2s/src/g.c"
ctl task add --task on-demand --server-ip 127.0.0.1 --user s2s \
  --password-file "$work/password" --share projects
ctl run on-demand
await_run on-demand 60
verify

step "a realtime task: each change of docs reaches the server within seconds"
ctl task add --task live --server-ip 127.0.0.1 --user s2s \
  --password-file "$work/password" --share docs --schedule realtime \
  --settle 0.5
# Waits (at most $2 seconds) until test $1 holds.
await() {
  local i
  for i in $(seq $(($2 * 10))); do
    if eval "$1"; then echo "  after $(((i - 1) / 10)).$(((i - 1) % 10)) s"; return 0; fi
    sleep 0.1
  done
  echo "demo: no sign of [$1] within $2 s" >&2
  cat "$work/s2sd.log" >&2
  return 1
}
await 'ctl --json status | grep -q "\"state\": \"watching\""' 30
echo "Written while the task watches." >"$d/docs/live.txt"
echo "docs/live.txt written on the client"
await 'cmp -s "$d/docs/live.txt" "$server/volume1/docs/live.txt"' 20
rm "$d/docs/README.txt"
echo "docs/README.txt deleted on the client"
await '[ ! -e "$server/volume1/docs/README.txt" ]' 20
verify

step "service status, a task as scripts see it (no password in it)"
ctl status
ctl --json task show nightly

step "stop the client service"
kill -TERM "$s2sd_pid"
wait "$s2sd_pid"
s2sd_pid=
echo "s2sd stopped"

step "stop the server's daemon"
"$server_bin" --root "$server" stop
echo
echo "demo: OK"
