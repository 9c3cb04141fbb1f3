#!/usr/bin/env bash
# Configures and builds one configuration: normal (default), asan, or
# aarch64 (cross-built against Debian's arm64 packages, run under qemu-aarch64).
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
kind=${1:-normal}
case "$kind" in
  normal) flags=(-DCMAKE_BUILD_TYPE=RelWithDebInfo) ;;
  asan)   flags=(-DCMAKE_BUILD_TYPE=Debug -DKM_SANITIZE=ON -DKM_BUILD_BENCH=OFF) ;;
  aarch64) flags=(-DCMAKE_BUILD_TYPE=RelWithDebInfo -DKM_BUILD_BENCH=OFF
                  -DCMAKE_TOOLCHAIN_FILE="$root/cmake/aarch64-linux-gnu.cmake") ;;
  *) echo "usage: $0 [normal|asan|aarch64]" >&2; exit 2 ;;
esac
cmake -S "$root" -B "$root/build/$kind" -G Ninja "${flags[@]}" >/dev/null
cmake --build "$root/build/$kind"
