#!/bin/sh
# Renders each manual page with man -l and fails on any warning of the
# formatter or a page without its NAME section.
#   check-man.sh DIR PAGE...
set -u
dir=$1
shift
status=0
rendered=$(mktemp)
trap 'rm -f "$rendered"' EXIT
for page in "$@"; do
  # One rendering: the page to a file, the formatter's warnings to $out.
  out=$(LC_ALL=C.UTF-8 MANWIDTH=80 man --warnings -l "$dir/$page" 2>&1 >"$rendered")
  text=$(cat "$rendered")
  if [ -n "$out" ]; then
    echo "$page: $out" >&2
    status=1
  elif ! printf '%s\n' "$text" | grep -q '^NAME'; then
    echo "$page: no NAME section" >&2
    status=1
  else
    echo "$page: renders ($(printf '%s\n' "$text" | wc -l) lines)"
  fi
done
exit $status
