#!/usr/bin/env bash
# Installs the Debian packages the build needs, when any is missing.
# With "aarch64", also what the aarch64 configuration needs: Debian's arm64
# libraries through multiarch and qemu-aarch64 to run the tests.
set -euo pipefail
# The normal configuration builds the TA for aarch64 too (g++-aarch64-linux-gnu)
# and checks its stack with python3.
pkgs=(cmake ninja-build g++ pkg-config libssl-dev libgtest-dev libgmock-dev libbenchmark-dev libcli11-dev nlohmann-json3-dev help2man clang-format openssl libp11-kit-dev
      g++-aarch64-linux-gnu python3)
# The fuzz harnesses (scripts/fuzz.sh): clang 14, its sanitizer and libFuzzer
# runtimes, and llvm-symbolizer for their reports.
pkgs+=(clang-14 libclang-rt-14-dev llvm-14)
SUDO=""; [ "$(id -u)" -ne 0 ] && SUDO=sudo
if [ "${1:-}" = aarch64 ]; then
  pkgs+=(qemu-user libssl-dev:arm64 libgtest-dev:arm64 libgmock-dev:arm64)
  if ! dpkg --print-foreign-architectures | grep -qx arm64; then
    echo "Adding the arm64 architecture"
    $SUDO dpkg --add-architecture arm64
  fi
fi
missing=()
for p in "${pkgs[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "Installing: ${missing[*]}"
  $SUDO apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y -qq "${missing[@]}"
fi
