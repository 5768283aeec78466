#!/usr/bin/env bash
# Source rules that the compiler does not check:
#  1. Only src/platform may include Linux system headers; every other layer
#     reaches the operating system through the platform layer.
#  2. The sources, tests, benchmark, examples, fuzz targets and project files
#     speak for themselves: they name no outside design papers and cite no
#     numbered sections of them.
# Usage: check_layering.sh <source-root>. Prints every offending line and
# exits 1 when there is one.
set -uo pipefail

root=${1:?usage: check_layering.sh <source-root>}
cd "$root" || { echo "layering: no such directory: $root" >&2; exit 2; }
[ -d src ] || { echo "layering: $root has no src/" >&2; exit 2; }

failed=0

# Rule 1. Angle or quoted includes of POSIX / Linux system headers.
system_headers='(sys/[^">]*|netinet/[^">]*|arpa/[^">]*|linux/[^">]*|net/[^">]*|pthread\.h|poll\.h|unistd\.h|fcntl\.h|netdb\.h|ifaddrs\.h|semaphore\.h|sched\.h)'
include_re="^[[:space:]]*#[[:space:]]*include[[:space:]]*[<\"]${system_headers}[\">]"
hits=$(grep -rnIE "$include_re" src 2>/dev/null | grep -v '^src/platform/' || true)
if [ -n "$hits" ]; then
  echo "layering: Linux system headers outside src/platform (use the platform layer):"
  printf '%s\n' "$hits" | sed 's/^/  /'
  failed=1
fi

# Rule 2. Two words, whole and in any case; and a capital P word followed by
# a dotted section number.
w1='s''pec'
w2='s''pecification'
dirs=()
for d in src tests bench examples fuzz scripts .ci cmake; do
  [ -e "$d" ] && dirs+=("$d")
done
files=()
for f in README.md CMakeLists.txt CMakePresets.json; do
  [ -e "$f" ] && files+=("$f")
done
targets=("${dirs[@]}" "${files[@]}")
if [ ${#targets[@]} -gt 0 ]; then
  words=$(grep -rnIiwE "(${w1}|${w2})" "${targets[@]}" 2>/dev/null || true)
  if [ -n "$words" ]; then
    echo "layering: references to an outside design paper (state the rule itself instead):"
    printf '%s\n' "$words" | sed 's/^/  /'
    failed=1
  fi
  cites=$(grep -rnIE "\\bPart [0-9]+\\.[0-9]+" "${targets[@]}" 2>/dev/null || true)
  if [ -n "$cites" ]; then
    echo "layering: numbered section citations (state the rule itself instead):"
    printf '%s\n' "$cites" | sed 's/^/  /'
    failed=1
  fi
fi

if [ "$failed" -eq 0 ]; then
  echo "layering: ok"
fi
exit "$failed"
