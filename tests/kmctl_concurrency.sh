#!/usr/bin/env bash
# Several kmctl processes on one new state directory never lose a key: 8
# first-use generates started at once, then 8 signs at once, three rounds;
# every command succeeds and every blob opens afterwards.
# Usage: kmctl_concurrency.sh KMCTL
set -euo pipefail
kmctl=$1
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }
n=8
printf 'message' >"$work/msg"

# at_once WHAT ROUND ARGS...: n kmctl runs on the round's state directory
# started together, @I@ in ARGS standing for the run's number; all must succeed.
at_once() {
  local what=$1 round=$2 i
  shift 2
  local pids=()
  for i in $(seq $n); do
    "$kmctl" --state "$work/state$round" --log-level none "${@//@I@/$i}" 2>"$work/$what$round.$i.err" &
    pids+=($!)
  done
  for i in $(seq $n); do
    wait "${pids[$((i - 1))]}" || fail "round $round: $what $i failed: $(cat "$work/$what$round.$i.err")"
  done
}

for round in 1 2 3; do
  state=$work/state$round
  at_once generate $round generate --algorithm hmac --size 256 --digest sha256 --out "$work/k$round.@I@"
  at_once sign $round sign --key "$work/k$round.@I@" --in "$work/msg" --out "$work/s$round.@I@"
  # One device identity: every blob opens and every MAC verifies afterwards.
  for i in $(seq $n); do
    "$kmctl" --state "$state" --log-level none verify --key "$work/k$round.$i" --in "$work/msg" \
      --signature "$work/s$round.$i" || fail "round $round: blob $i does not open or verify afterwards"
  done
  [ "$(ls "$state" | grep -c '^device_id')" = 1 ] || fail "round $round: temporaries left: $(ls "$state")"
done
echo "concurrency ok"
