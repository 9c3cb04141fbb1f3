#!/usr/bin/env bash
# The libFuzzer harnesses of fuzz/.
#
#   scripts/fuzz.sh --list            the target names, one a line
#   scripts/fuzz.sh TARGET SECONDS    builds what TARGET needs (clang, into
#                                     build/fuzz) and fuzzes it for SECONDS
#                                     on fuzz/corpus/TARGET
#
# New inputs go to build/fuzz/scratch/TARGET/corpus, never into the tree;
# a crash, leak or sanitizer report leaves its input in
# build/fuzz/scratch/TARGET/ and makes the script exit nonzero. Extra
# libFuzzer flags may follow SECONDS (e.g. -jobs=2, -runs=N).
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)

targets() {
  for src in "$root"/fuzz/*_fuzz.cpp; do
    basename "$src" _fuzz.cpp
  done
}

usage() {
  echo "usage: scripts/fuzz.sh --list | TARGET SECONDS [libFuzzer flags...]" >&2
  exit 2
}

[ $# -ge 1 ] || usage
if [ "$1" = "--list" ]; then
  targets
  exit 0
fi
[ $# -ge 2 ] || usage
target=$1
seconds=$2
shift 2
targets | grep -x "$target" >/dev/null || { echo "fuzz.sh: no target $target (see --list)" >&2; exit 2; }
[[ "$seconds" =~ ^[0-9]+$ ]] && [ "$seconds" -gt 0 ] || usage

build="$root/build/fuzz"
cc=$(command -v clang-14 || command -v clang || true)
cxx=$(command -v clang++-14 || command -v clang++ || true)
if [ -z "$cc" ] || [ -z "$cxx" ]; then
  echo "fuzz.sh: clang is missing (scripts/deps.sh installs it)" >&2
  exit 2
fi
if [ ! -f "$build/CMakeCache.txt" ]; then
  CC=$cc CXX=$cxx cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKM_FUZZ=ON \
    -DKM_BUILD_TESTS=OFF -DKM_BUILD_BENCH=OFF >/dev/null
fi
cmake --build "$build" --target "fuzz_$target" -j2

scratch="$build/scratch/$target"
mkdir -p "$scratch/corpus"
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1:symbolize=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
# The harness's emulated TEE keeps its state here, out of the tree, one
# directory per harness process (-jobs starts several).
rm -rf "$scratch/state"
export KM_FUZZ_STATE="$scratch/state"
cd "$scratch"
# The first directory receives new inputs; the tree's seeds are only read.
"$build/fuzz/fuzz_$target" -max_total_time="$seconds" -timeout=30 -rss_limit_mb=2048 -print_final_stats=1 \
  -artifact_prefix="$scratch/" "$@" "$scratch/corpus" "$root/fuzz/corpus/$target"
