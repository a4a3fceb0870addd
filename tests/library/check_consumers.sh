#!/usr/bin/env bash
# Installs the build into a temporary prefix and builds a small program against the
# installed library twice: with pkg-config and with the CMake package. Both must build
# and run.
# Usage: check_consumers.sh BUILD_DIR "EXTRA_COMPILER_FLAGS"
set -euo pipefail
build=$1
flags=${2:-}
here=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

cmake --install "$build" --prefix "$work/prefix" >"$work/install.log"
pc=$(find "$work/prefix" -name telvane.pc)
[ -n "$pc" ] || { echo "no telvane.pc installed"; exit 1; }
libdir=$(dirname "$(dirname "$pc")")

echo "== pkg-config"
export PKG_CONFIG_PATH="$(dirname "$pc")"
pkg-config --modversion telvane
# shellcheck disable=SC2046,SC2086
c++ -std=c++20 $flags "$here/consumer/consumer.cpp" $(pkg-config --cflags --libs telvane) -o "$work/pc-consumer"
LD_LIBRARY_PATH="$libdir" "$work/pc-consumer"

echo "== CMake package"
cmake -S "$here/consumer" -B "$work/cmake-consumer" -G Ninja -DCMAKE_PREFIX_PATH="$work/prefix" \
  -DCMAKE_CXX_FLAGS="$flags" >"$work/cmake.log" || { cat "$work/cmake.log"; exit 1; }
cmake --build "$work/cmake-consumer" >"$work/build.log" || { cat "$work/build.log"; exit 1; }
LD_LIBRARY_PATH="$libdir" "$work/cmake-consumer/consumer"

# The C interface, compiled as C, when the installed headers have it.
if [ -f "$work/prefix/include/telvane/telvane.h" ] && [ -f "$here/consumer/consumer.c" ]; then
  echo "== C with pkg-config"
  # shellcheck disable=SC2046,SC2086
  cc -std=c99 -Wall -Werror $flags "$here/consumer/consumer.c" $(pkg-config --cflags --libs telvane) -o "$work/c-consumer"
  LD_LIBRARY_PATH="$libdir" "$work/c-consumer"
fi
echo "consumers: ok"
