#!/usr/bin/env bash
# Builds the normal, the ASan+UBSan and the aarch64 configuration and runs
# the tests: every test in the first two; in aarch64, under qemu-aarch64,
# every test but those that start a program of their own (below).
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
"$root/scripts/deps.sh" aarch64
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
# qemu-aarch64 runs the programs ctest starts; a program that a test starts
# itself (kmctl, kmd, a death test re-running its binary) would need the
# kernel to run aarch64 programs, which it does not here. The tree's own
# checks (formatting, the TA's includes) need no second run.
aarch64_skip='^(kmctl_.*|Kmctl.*|KmdTest\..*|TeeLifetime\.ATeeInAStaticEndsCleanlyAtProcessExit|clang_format|ta_include_whitelist)$'
for kind in normal asan aarch64; do
  echo "== $kind build =="
  "$root/scripts/build.sh" "$kind"
  echo "== $kind tests =="
  skip=()
  [ "$kind" = aarch64 ] && skip=(-E "$aarch64_skip")
  ctest --test-dir "$root/build/$kind" --output-on-failure -j "$(nproc)" "${skip[@]}"
  if [ "$kind" = normal ]; then
    echo "== TA stack budget (aarch64, freestanding) =="
    python3 "$root/scripts/stack_budget.py" --table "$root/scripts/stack_budget.table" "$root/build/normal/ta/ta_aarch64"
  fi
done
# Each fuzz harness a few seconds on its corpus (seeds and regression
# inputs): a smoke run; scripts/fuzz.sh TARGET SECONDS runs one for long.
echo "== fuzz smoke runs =="
for target in $("$root/scripts/fuzz.sh" --list); do
  log="$root/build/fuzz/smoke-$target.log"
  mkdir -p "$root/build/fuzz"
  if ! "$root/scripts/fuzz.sh" "$target" "${KM_FUZZ_SMOKE_SECONDS:-10}" >"$log" 2>&1; then
    tail -n 60 "$log"
    echo "fuzz smoke run of $target failed (whole log: $log)" >&2
    exit 1
  fi
  grep -E '^stat::number_of_executed_units' "$log" | sed "s/^/$target: /"
done
