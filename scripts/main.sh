#!/usr/bin/env bash
# Builds kmctl and runs it on the embedded TEE (default: "info").
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
"$root/scripts/deps.sh"
"$root/scripts/build.sh" normal
if [ $# -eq 0 ]; then set -- info; fi
exec "$root/build/normal/client/kmctl" "$@"
