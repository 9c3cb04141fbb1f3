#!/usr/bin/env bash
# Builds kmctl and runs it on the embedded TEE with the arguments given
# (default: "demo", which walks every capability): scripts/main.sh generate --algorithm hmac --out k.blob.
# The build's own output goes to stderr, so kmctl's stdout stays its own.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
"$root/scripts/deps.sh" >&2
cmake -S "$root" -B "$root/build/normal" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$root/build/normal" --target kmctl >&2
if [ $# -eq 0 ]; then set -- demo; fi
exec "$root/build/normal/client/kmctl" "$@"
