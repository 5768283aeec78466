#!/usr/bin/env bash
# Shows that check_layering.sh finds what it is meant to find: it runs the
# checker on small planted trees, each with one fault (or none), and compares
# its verdict with the expected one.
set -uo pipefail

checker=${1:?usage: selftest.sh <check_layering.sh> [scratch-dir]}
scratch=${2:-}
if [ -n "$scratch" ]; then
  mkdir -p "$scratch"
  work=$(mktemp -d "$scratch/layering.XXXXXX")
else
  work=$(mktemp -d)
fi
trap 'rm -rf "$work"' EXIT

w='s''pec'
failures=0
cases=0

# expect <0|1> <description> <path> <line>...: a fresh clean tree plus one
# file with the given lines.
expect() {
  local want=$1 what=$2 path=$3
  shift 3
  local tree="$work/case$cases"
  cases=$((cases + 1))
  mkdir -p "$tree/src/platform" "$tree/src/runtime" "$tree/tests" "$tree/bench"
  printf '#include <sys/socket.h>\n#include <unistd.h>\n' >"$tree/src/platform/ok.cpp"
  printf '#include "N_Initializer.h"\n#include <vector>\n' >"$tree/src/runtime/ok.cpp"
  printf '// the whole message is sent at once\n' >"$tree/tests/ok.cpp"
  if [ -n "$path" ]; then
    mkdir -p "$(dirname "$tree/$path")"
    printf '%s\n' "$@" >"$tree/$path"
  fi
  "$checker" "$tree" >"$tree.out" 2>&1
  local got=$?
  if [ "$got" -ne "$want" ]; then
    echo "FAIL: $what: checker exited $got, expected $want"
    sed 's/^/    /' "$tree.out"
    failures=$((failures + 1))
  else
    echo "ok:   $what"
  fi
}

expect 0 "clean tree" ""
expect 1 "socket header in the runtime layer" src/runtime/bad.cpp '#include <sys/socket.h>'
expect 1 "quoted unistd.h in the endpoints layer" src/endpoints/bad.h '#  include "unistd.h"'
expect 1 "pthread.h in client_server" src/client_server/bad.cpp '#include <pthread.h>'
expect 1 "netinet header in foundations" src/foundations/bad.cpp '#include <netinet/in.h>'
expect 1 "epoll in a nested platform folder of another layer" src/runtime/platform/bad.cpp '#include <sys/epoll.h>'
expect 0 "system headers inside src/platform" src/platform/more.cpp '#include <sys/eventfd.h>' '#include <poll.h>' '#include <netdb.h>'
expect 0 "standard C++ headers anywhere" src/runtime/fine.cpp '#include <thread>' '#include <csignal>'
expect 1 "the word in a test, lower case" tests/x/bad_test.cpp "// see the $w"
expect 1 "the long word in the source, capitalised" src/runtime/bad.cpp "// As the ${w^}ification says"
expect 1 "the word in the demo, upper case" examples/demo/bad.cpp "// ${w^^} section"
expect 1 "a numbered section in the benchmark" bench/bad.cpp "// as in Par""t 3.2"
expect 1 "a numbered section in a fuzz target" fuzz/bad_fuzz.cpp "// (Par""t 1.12)"
expect 0 "longer words that merely contain it" src/runtime/fine.cpp "// ${w}ial ${w}ified ${w}trum"
expect 0 "a part without a section number" src/runtime/fine.cpp "// part of the stream, Part two"

echo "layering self-test: $((cases - failures)) passed, $failures failed"
[ "$failures" -eq 0 ]
