#!/usr/bin/env bash
# cmake --install puts kmctl, its man page, the client library, its headers,
# a CMake package and a pkg-config file under a prefix; a small consumer
# project configures, builds and runs against that prefix alone.
# Usage: kmctl_install.sh BUILD_DIR CONSUMER_SOURCE_DIR VERSION [LINK_FLAGS]
set -euo pipefail
build=$1 consumer=$2 version=$3 link_flags=${4:-}
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }

cmake --install "$build" --prefix "$work/prefix" >/dev/null
p=$work/prefix
lib=$(cd "$p" && ls -d lib*/cmake/KeymasterClient | head -1 | cut -d/ -f1)
for f in bin/kmctl share/man/man1/kmctl.1 "$lib/libkm_client.a" "$lib/libkeymaster_ta.a" "$lib/libtee_platform.a" \
  include/keymaster-client/km/client.h include/keymaster-client/km/embedded_tee.h \
  include/keymaster-client/tee_api_types.h "$lib/cmake/KeymasterClient/KeymasterClientConfig.cmake" \
  "$lib/cmake/KeymasterClient/KeymasterClientConfigVersion.cmake" "$lib/pkgconfig/keymaster-client.pc" \
  "$lib/libsoter_verifier.a" include/keymaster-client/soter/verifier.h "$lib/pkgconfig/soter-verifier.pc"; do
  [ -f "$p/$f" ] || fail "not installed: $f"
done

# The installed kmctl and its man page tell the project's version.
[ "$("$p/bin/kmctl" --version)" = "kmctl $version" ] || fail "installed kmctl --version: $("$p/bin/kmctl" --version)"
grep -q "kmctl $version" "$p/share/man/man1/kmctl.1" || fail "the man page does not carry the version"
grep -q 'state.fR DIR' "$p/share/man/man1/kmctl.1" || fail "the man page lacks the global options"

[ "$(PKG_CONFIG_PATH=$p/$lib/pkgconfig pkg-config --modversion keymaster-client)" = "$version" ] ||
  fail "pkg-config does not find keymaster-client $version"
PKG_CONFIG_PATH=$p/$lib/pkgconfig pkg-config --libs keymaster-client | grep -q -- -lkm_client ||
  fail "pkg-config --libs lacks the client library"

# The consumer sees only the prefix: the source tree is not on its path.
cmake -S "$consumer" -B "$work/consumer" -G Ninja -DCMAKE_PREFIX_PATH="$p" -DCMAKE_BUILD_TYPE=Release \
  -DCMAKE_EXE_LINKER_FLAGS="$link_flags" >/dev/null
cmake --build "$work/consumer" >/dev/null
out=$("$work/consumer/consumer" "$work/state")
grep -qx rsa <<<"$out" || fail "the consumer lists no rsa: $out"
grep -q '^generated a blob of [1-9][0-9]* bytes$' <<<"$out" || fail "the consumer generated no key: $out"
# The installed verifier checks a statement the installed kmctl made.
k=("$p/bin/kmctl" --state "$work/state" --log-level none)
"${k[@]}" soter provision >/dev/null 2>&1 || fail "soter provision"
"${k[@]}" soter attk export --out "$work/attk.pem" || fail "soter attk export"
"${k[@]}" generate --algorithm rsa --size 1024 --soter --soter-sign-with attk --out "$work/soter.blob" ||
  fail "generate a SOTER key"
"${k[@]}" export --key "$work/soter.blob" --out "$work/statement" || fail "export the SOTER key"
[ "$("$work/consumer/server_check" "$work/attk.pem" "$work/statement")" = valid ] ||
  fail "the installed verifier refuses a good statement"
printf x >>"$work/statement"
[ "$("$work/consumer/server_check" "$work/attk.pem" "$work/statement")" = signature ] ||
  fail "the installed verifier takes a statement with a byte appended"
echo "install ok"
