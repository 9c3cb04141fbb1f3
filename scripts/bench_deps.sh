#!/usr/bin/env bash
# Installs what km_bench's SoftHSM2 columns need beyond the build: Debian's
# softhsm2, the PKCS#11 module km_bench loads at run time. The tests never
# need it, and km_bench runs without it, printing "n/a" in those columns.
set -euo pipefail
dpkg-query -W -f='${Status}' softhsm2 2>/dev/null | grep -q "install ok installed" && exit 0
SUDO=""; [ "$(id -u)" -ne 0 ] && SUDO=sudo
echo "Installing: softhsm2"
$SUDO apt-get update -qq
DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y -qq softhsm2
