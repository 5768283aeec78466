#!/usr/bin/env bash
# readme_getting_started: runs the README's echo server as host 127.0.0.1,
# then its client as host 127.0.0.2 (on one machine each process needs an
# address of its own). Passes when the client got all its events back, the
# server saw it join and leave, and both ended by themselves without error.
#
#   run_getting_started.sh SERVER_PROGRAM CLIENT_PROGRAM WORK_DIR
set -u
server=$1 client=$2 work=$3
log=$work/getting_started_server.log
mkdir -p "$work"
rm -f "$log"

# Long enough for the client's events (about a second) and for the server to
# notice that the client left.
"$server" 4 127.0.0.1 >"$log" 2>&1 &
pid=$!
# The client connects once and doesn't retry: start it when the server listens.
for _ in $(seq 200); do
  grep -q '^server: listening' "$log" 2>/dev/null && break
  kill -0 "$pid" 2>/dev/null || break
  sleep 0.05
done
out=$("$client" 127.0.0.1 127.0.0.2 2>&1)
client_rc=$?
wait "$pid"
server_rc=$?

echo "--- client (exit $client_rc)"
echo "$out"
echo "--- server (exit $server_rc)"
cat "$log"

fail() {
  echo "readme_getting_started: $1" >&2
  exit 1
}
[ "$client_rc" -eq 0 ] || fail "the client failed"
echo "$out" | grep -q '^client: 20 of 20 events echoed$' || fail "the client didn't get its 20 events back"
[ "$server_rc" -eq 0 ] || fail "the server failed"
grep -q '^server: a client joined$' "$log" || fail "the server never handed out the client"
grep -q '^server: a client left$' "$log" || fail "the server didn't remove the client that left"
echo "readme_getting_started: passed"
