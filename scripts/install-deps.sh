#!/usr/bin/env bash
# Installs the build and test tools of vardel on Debian 12, only what is
# missing. Fast and quiet when everything is present already.
set -euo pipefail

# cmake/ninja/g++ build the library; clang with clang's runtime
# (libclang_rt.fuzzer and the sanitizer runtimes) builds the fuzz targets;
# GoogleTest/GoogleMock the tests; Google Benchmark the benchmark program;
# ENet and ZeroMQ are the transports the benchmark program compares with
# (it leaves their columns out without them), matplotlib draws its ratio
# chart; tshark runs the Wireshark dissector over captured test traffic, doxygen
# makes the API reference, dpkg-dev checks the Debian packages.
PACKAGES=(
  cmake
  ninja-build
  g++
  clang
  libclang-rt-14-dev
  libgtest-dev
  libgmock-dev
  libbenchmark-dev
  libenet-dev
  libzmq3-dev
  python3-matplotlib
  pkg-config
  tshark
  doxygen
  dpkg-dev
)

installed() {
  [ "$(dpkg-query -W -f='${db:Status-Status}' "$1" 2>/dev/null)" = "installed" ]
}

if ! command -v dpkg-query >/dev/null 2>&1 || ! command -v apt-get >/dev/null 2>&1; then
  echo "install-deps: this script installs with apt-get (Debian 12); install these by hand: ${PACKAGES[*]}" >&2
  # Carry on if the tools are there anyway; the build says what is missing.
  exit 0
fi

missing=()
for p in "${PACKAGES[@]}"; do
  installed "$p" || missing+=("$p")
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "install-deps: all build dependencies present"
  exit 0
fi

SUDO=()
if [ "$(id -u)" -ne 0 ]; then
  if command -v sudo >/dev/null 2>&1; then
    SUDO=(sudo)
  else
    echo "install-deps: missing ${missing[*]}, and not root with no sudo to install them" >&2
    exit 1
  fi
fi

echo "install-deps: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
"${SUDO[@]}" env DEBIAN_FRONTEND=noninteractive apt-get update -q
"${SUDO[@]}" env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends "${missing[@]}"

for p in "${missing[@]}"; do
  if ! installed "$p"; then
    echo "install-deps: $p did not install" >&2
    exit 1
  fi
done
echo "install-deps: done"
