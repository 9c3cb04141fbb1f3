#!/usr/bin/env bash
# Fails, naming each, when the TA's freestanding object needs what a TEE
# does not give a TA. Undefined symbols may only be:
#   TEE_*                 the GlobalPlatform Internal Core API and this
#                         platform's extensions, the TA's trace and
#                         allocation hooks (TEE_Trace, TEE_MallocAt,
#                         TEE_ReallocAt) among them;
#   memcpy memmove memset memcmp strlen
#                         which the compiler emits for copies and which
#                         every TEE's C library has;
#   snprintf vsnprintf    bounded formatting (not sprintf and vsprintf).
# Thread-local data and static constructors fail too: a TEE has no TLS
# and runs no C++ start-up code.
#
# usage: check_ta_freestanding.sh NM READELF OBJECT
#        check_ta_freestanding.sh --expect-reject NAME [--expect-reject NAME...] -- NM READELF OBJECT
# The second form is the checker's own test: it passes only when the check
# refuses OBJECT and names every NAME among its refusals.
set -euo pipefail

expected=()
while [ $# -gt 0 ] && [ "$1" = --expect-reject ]; do
  expected+=("$2")
  shift 2
done
[ $# -gt 0 ] && [ "$1" = -- ] && shift
if [ $# -ne 3 ]; then
  echo "usage: $0 [--expect-reject NAME]... [--] NM READELF OBJECT" >&2
  exit 2
fi
nm=$1
readelf=$2
object=$3
[ -f "$object" ] || { echo "no object $object" >&2; exit 2; }

# check - prints one "refused: ..." line per fault and the allowed symbols;
# returns 1 when anything was refused.
check() {
  local refused=0 allowed=() sym name
  while read -r sym; do
    [ -n "$sym" ] || continue
    case "$sym" in
      TEE_* | memcpy | memmove | memset | memcmp | strlen | snprintf | vsnprintf)
        allowed+=("$sym")
        continue
        ;;
    esac
    name=$(c++filt "$sym")
    echo "refused: undefined symbol $name ($sym)"
    refused=1
  done < <("$nm" -u "$object" | awk '{print $NF}' | sort -u)

  # Symbols of type TLS, defined or undefined, and sections of thread-local data.
  while read -r sym; do
    echo "refused: thread-local $(c++filt "$sym")"
    refused=1
  done < <("$readelf" -sW "$object" | awk '$4 == "TLS" && $8 != "" && $8 !~ /^(\$|\.L)/ {print $8}' | sort -u)
  while read -r sym; do
    echo "refused: thread-local section $sym"
    refused=1
  done < <("$readelf" -SW "$object" | grep -oE '\.(tdata|tbss)[^ ]*' | sort -u)

  # Static constructors and destructors: the functions GCC emits for them
  # and the sections that would list them for a C++ start-up.
  while read -r sym; do
    echo "refused: static constructor $sym"
    refused=1
  done < <("$nm" "$object" | awk '$NF ~ /^_GLOBAL__sub_[ID]_/ {print $NF}' | sort -u)
  while read -r sym; do
    echo "refused: start-up section $sym"
    refused=1
  done < <("$readelf" -SW "$object" | grep -oE '\.(init_array|fini_array|preinit_array|ctors|dtors)[^ ]*' | sort -u)

  if [ "$refused" -eq 0 ]; then
    echo "$(basename "$object"): ${#allowed[@]} undefined symbols, all allowed:"
    printf '  %s\n' "${allowed[@]}"
  fi
  return "$refused"
}

if [ ${#expected[@]} -eq 0 ]; then
  check
  exit
fi

status=0
out=$(check) || status=$?
echo "$out"
if [ "$status" -eq 0 ]; then
  echo "FAIL: the check accepted $object"
  exit 1
fi
missing=0
for name in "${expected[@]}"; do
  if ! grep '^refused: ' <<<"$out" | grep -qF -- "$name"; then
    echo "FAIL: no refusal names $name"
    missing=1
  fi
done
[ "$missing" -eq 0 ] && echo "the check refused $(basename "$object") naming: ${expected[*]}"
exit "$missing"
