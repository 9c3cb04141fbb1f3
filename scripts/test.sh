#!/usr/bin/env bash
# Builds the normal and the ASan+UBSan configuration and runs every test in both.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
"$root/scripts/deps.sh"
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
for kind in normal asan; do
  echo "== $kind build =="
  "$root/scripts/build.sh" "$kind"
  echo "== $kind tests =="
  ctest --test-dir "$root/build/$kind" --output-on-failure -j "$(nproc)"
done
