#!/usr/bin/env bash
# Configures and builds one configuration: normal (default) or asan.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
kind=${1:-normal}
case "$kind" in
  normal) flags=(-DCMAKE_BUILD_TYPE=RelWithDebInfo) ;;
  asan)   flags=(-DCMAKE_BUILD_TYPE=Debug -DKM_SANITIZE=ON -DKM_BUILD_BENCH=OFF) ;;
  *) echo "usage: $0 [normal|asan]" >&2; exit 2 ;;
esac
cmake -S "$root" -B "$root/build/$kind" -G Ninja "${flags[@]}" >/dev/null
cmake --build "$root/build/$kind"
