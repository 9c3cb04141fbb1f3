#!/bin/bash
# kmctl against the openssl command line with EC keys: a P-384 key from
# openssl genpkey imports, its exported public key is OpenSSL's, signatures
# verify both ways, and keys on other curves are refused by name.
set -u
kmctl=$(realpath "$1")
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
export KMCTL_STATE=$work/state
cd "$work" || exit 1
fail=0
check() { # check WHAT COMMAND...: the command must succeed
    local what=$1
    shift
    if ! "$@" >out.txt 2>err.txt; then
        echo "FAIL: $what"
        cat out.txt err.txt
        fail=1
    fi
}

openssl genpkey -algorithm EC -pkeyopt ec_paramgen_curve:P-384 -out p384.pem 2>/dev/null || exit 1
head -c 1000 /dev/urandom >msg
check "import a P-384 key" "$kmctl" import --algorithm ec --digest sha384,sha256 --in p384.pem --out k.blob
check "export PEM" "$kmctl" export --key k.blob --format pem --out pub.pem
openssl pkey -in p384.pem -pubout -out expected.pem
check "exported key is the imported one" cmp pub.pem expected.pem
check "export DER" "$kmctl" export --key k.blob --format der --out pub.der
check "DER parses as the same key" sh -c 'openssl pkey -pubin -inform DER -in pub.der -outform PEM | cmp - expected.pem'

for d in sha384 sha256; do
    check "kmctl sign $d" "$kmctl" sign --key k.blob --digest $d --in msg --out kmctl.sig
    check "openssl verifies kmctl's $d signature" openssl dgst -$d -verify pub.pem -signature kmctl.sig msg
    check "openssl sign $d" openssl dgst -$d -sign p384.pem -out openssl.sig msg
    check "kmctl verifies openssl's $d signature" "$kmctl" verify --key k.blob --digest $d --in msg --signature openssl.sig
done
echo tampered >>msg
if "$kmctl" --log-level none verify --key k.blob --digest sha384 --in msg --signature openssl.sig 2>err.txt; then
    echo "FAIL: a signature over other data verified"
    fail=1
fi
grep -q 'KM_ERROR_VERIFICATION_FAILED (-30)' err.txt || { echo "FAIL: no verification failure reported"; cat err.txt; fail=1; }

# A key made by kmctl on P-521, checked by openssl alone.
check "generate P-521" "$kmctl" generate --algorithm ec --size 521 --digest sha512 --out g.blob
check "export P-521" "$kmctl" export --key g.blob --out g.pem
check "P-521 signature" "$kmctl" sign --key g.blob --digest sha512 --in msg --out g.sig
check "openssl verifies the P-521 signature" openssl dgst -sha512 -verify g.pem -signature g.sig msg

# Another curve is a usage error that names it, before any key is written.
openssl genpkey -algorithm EC -pkeyopt ec_paramgen_curve:secp256k1 -out k1.pem 2>/dev/null || exit 1
"$kmctl" import --algorithm ec --in k1.pem --out k1.blob 2>err.txt
status=$?
[ "$status" -eq 2 ] || { echo "FAIL: secp256k1 import exit $status, expected 2"; fail=1; }
grep -q 'secp256k1' err.txt || { echo "FAIL: the refusal does not name the curve"; cat err.txt; fail=1; }
[ ! -e k1.blob ] || { echo "FAIL: a blob was written for a refused key"; fail=1; }

exit $fail
