#!/usr/bin/env bash
# The one demo command of vardel: installs missing tools, builds the demo
# program with the default preset and runs it with the arguments given.
#
#   scripts/demo.sh                    the shared world: a server and 4 client processes
#   scripts/demo.sh resolve [NAME] [NUMBER]
#   scripts/demo.sh transport          two processes exchanging messages
#   scripts/demo.sh --help             every mode and option
#
# Works from any directory.
# Environment (optional): VARDEL_BUILD_TAG (build tree build/<tag>default,
# by default build/default), VARDEL_JOBS (parallel build jobs, default 2).
set -euo pipefail

ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
cd "$ROOT"

BUILD_PREFIX="$ROOT/build/${VARDEL_BUILD_TAG:-}"
JOBS=${VARDEL_JOBS:-2}
dir="${BUILD_PREFIX}default"

"$ROOT/scripts/install-deps.sh" >&2
echo "demo.sh: configuring and building (preset default, $dir)" >&2
log=$(mktemp)
if ! cmake --preset default >"$log" 2>&1; then
  cat "$log" >&2
  rm -f "$log"
  echo "demo.sh: configuring failed" >&2
  exit 1
fi
if grep -q 'vardel_demo not built yet' "$log"; then
  grep 'vardel_demo not built yet' "$log" | sed 's/^-- /demo.sh: /' >&2
  rm -f "$log"
  exit 1
fi
rm -f "$log"
if ! cmake --build --preset default --parallel "$JOBS" --target vardel_demo >&2; then
  echo "demo.sh: building vardel_demo failed" >&2
  exit 1
fi

echo "demo.sh: running $dir/examples/vardel_demo $*" >&2
exec "$dir/examples/vardel_demo" "$@"
