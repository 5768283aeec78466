#!/usr/bin/env bash
# Runs the hostile-peer scenarios (tests/client_server/hostile_test.cpp) on
# the default build, each in a process of its own as CTest does, and prints
# what each attack cost the server: its peak RSS, its longest update() and
# the good clients' p99 round trip while the attack ran.
#
#   scripts/hostile-report.sh [GTEST_FILTER]     e.g. 'HostileTest.Drip'
#
# Port 6000 must be free: don't run it beside other server tests.
set -euo pipefail
root="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
cd "$root"
cmake --preset default >/dev/null
cmake --build --preset default --target hostile_test
binary="build/${VARDEL_BUILD_TAG:-}default/tests/client_server/hostile_test"
report="$(mktemp)"
trap 'rm -f "$report"' EXIT

failed=()
for test in $("$binary" --gtest_list_tests --gtest_filter="${1:-*}" | awk '/^[^ ]/ {suite = $1} /^  / {print suite $1}'); do
  VARDEL_HOSTILE_REPORT="$report" "$binary" --gtest_filter="$test" || failed+=("$test")
done

echo
echo "| Scenario | Peak RSS MB (before) | Longest update ms | p99 RTT ms |"
echo "|---|---|---|---|"
while IFS=$'\t' read -r name peak before update p99; do
  echo "| $name | $peak ($before) | $update | $p99 |"
done <"$report"
if ((${#failed[@]} > 0)); then
  echo
  echo "Failed: ${failed[*]}"
  exit 1
fi
