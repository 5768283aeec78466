#!/usr/bin/env bash
# The one test command of vardel.
#
#   scripts/test.sh          install missing tools, then build and test the
#                            presets default, asan and tsan, then build the
#                            fuzz preset and run every fuzz target briefly
#   scripts/test.sh quick    the default preset only
#   scripts/test.sh asan fuzz ...   only the steps named (default, asan,
#                            tsan, fuzz), in the order given
#
# Works from any directory. Stops at the first failure and says which step
# failed; prints a summary either way.
#
# Environment (optional):
#   VARDEL_BUILD_TAG      build trees go to build/<tag><preset> (default: none,
#                         so build/default, build/asan, ...)
#   VARDEL_FUZZ_SECONDS   time for each fuzz target (default: 20)
#   VARDEL_JOBS           parallel build jobs (default: 2)
set -euo pipefail

ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
cd "$ROOT"

usage() {
  sed -n '2,18p' "${BASH_SOURCE[0]}" | sed 's/^# \{0,1\}//'
}

STEPS=()
if [ $# -eq 0 ]; then
  STEPS=(default asan tsan fuzz)
else
  for arg in "$@"; do
    case "$arg" in
      quick) STEPS+=(default) ;;
      default | asan | tsan | fuzz) STEPS+=("$arg") ;;
      -h | --help)
        usage
        exit 0
        ;;
      *)
        echo "test.sh: unknown step '$arg'" >&2
        usage >&2
        exit 2
        ;;
    esac
  done
fi

BUILD_PREFIX="$ROOT/build/${VARDEL_BUILD_TAG:-}"
FUZZ_SECONDS=${VARDEL_FUZZ_SECONDS:-20}
JOBS=${VARDEL_JOBS:-2}

SUMMARY=()
PASSED=0
FAILED=0
START=$SECONDS

summary() {
  echo
  echo "==================== vardel test summary ===================="
  local line
  for line in "${SUMMARY[@]}"; do
    echo "  $line"
  done
  echo "  total time: $((SECONDS - START)) s"
  echo "============================================================="
  echo "summary: $PASSED passed, $FAILED failed"
}

fail() {
  SUMMARY+=("FAILED: $1")
  echo >&2
  echo "test.sh: FAILED: $1" >&2
  summary
  exit 1
}

banner() {
  echo
  echo "==== $* ===="
}

# run <description> <command...>: runs a step, fails the whole run if it fails.
run() {
  local what=$1
  shift
  local t0=$SECONDS
  banner "$what"
  if ! "$@"; then
    FAILED=$((FAILED + 1))
    fail "$what"
  fi
  SUMMARY+=("ok      $what ($((SECONDS - t0)) s)")
}

# test_preset <preset>: configure, build and run the tests of one preset.
test_preset() {
  local preset=$1
  local dir="${BUILD_PREFIX}${preset}"
  run "configure $preset" cmake --preset "$preset"
  run "build $preset" cmake --build --preset "$preset" --parallel "$JOBS"

  local t0=$SECONDS log="$dir/ctest.log"
  banner "test $preset"
  set +e
  ctest --preset "$preset" 2>&1 | tee "$log"
  local rc=${PIPESTATUS[0]}
  set -e
  # "100% tests passed, 0 tests failed out of 42"
  local counts total failed
  counts=$(grep -Eo '[0-9]+ tests failed out of [0-9]+' "$log" | tail -1 || true)
  total=$(echo "$counts" | awk '{print $6}')
  failed=$(echo "$counts" | awk '{print $1}')
  total=${total:-0}
  failed=${failed:-0}
  PASSED=$((PASSED + total - failed))
  FAILED=$((FAILED + failed))
  if [ "$rc" -ne 0 ]; then
    [ "$failed" -gt 0 ] || FAILED=$((FAILED + 1))
    fail "test $preset: $failed of $total tests failed (ctest exit $rc; log: $log)"
  fi
  if [ "$total" -eq 0 ]; then
    FAILED=$((FAILED + 1))
    fail "test $preset: no tests ran"
  fi
  SUMMARY+=("ok      test $preset: $total tests passed ($((SECONDS - t0)) s)")
}

# fuzz_smoke: build the fuzz preset and run each target for a bounded time.
fuzz_smoke() {
  local preset=fuzz
  local dir="${BUILD_PREFIX}${preset}"
  run "configure $preset" cmake --preset "$preset"
  run "build $preset" cmake --build --preset "$preset" --parallel "$JOBS"

  local manifest="$dir/fuzz/fuzz_targets.txt"
  if [ ! -f "$manifest" ]; then
    FAILED=$((FAILED + 1))
    fail "fuzz: $manifest was not generated"
  fi
  if [ ! -s "$manifest" ]; then
    SUMMARY+=("ok      fuzz: no fuzz targets yet (fuzz/*_fuzz.cpp)")
    return 0
  fi
  local name exe
  while read -r name exe; do
    [ -n "$name" ] || continue
    local t0=$SECONDS
    local work="$dir/fuzz-run/$name"
    local seeds="$ROOT/fuzz/corpus/$name"
    rm -rf "$work"
    mkdir -p "$work/corpus" "$work/artifacts"
    local corpora=("$work/corpus")  # new inputs go here, never into the repo
    [ -d "$seeds" ] && corpora+=("$seeds")
    banner "fuzz $name for ${FUZZ_SECONDS} s"
    if ! "$exe" -max_total_time="$FUZZ_SECONDS" -timeout=10 -rss_limit_mb=2048 -print_final_stats=1 \
        -artifact_prefix="$work/artifacts/" "${corpora[@]}" >"$work/fuzz.log" 2>&1; then
      tail -n 60 "$work/fuzz.log"
      FAILED=$((FAILED + 1))
      fail "fuzz $name: a fault was found (log: $work/fuzz.log, input in $work/artifacts/)"
    fi
    PASSED=$((PASSED + 1))
    local runs
    runs=$(grep -Eo 'stat::number_of_executed_units: *[0-9]+' "$work/fuzz.log" | grep -Eo '[0-9]+$' || echo '?')
    SUMMARY+=("ok      fuzz $name: $runs inputs, no fault ($((SECONDS - t0)) s)")
  done <"$manifest"
}

echo "vardel tests (${STEPS[*]}) in $ROOT"
run "install dependencies" "$ROOT/scripts/install-deps.sh"

for step in "${STEPS[@]}"; do
  if [ "$step" = fuzz ]; then
    fuzz_smoke
  else
    test_preset "$step"
  fi
done

summary
