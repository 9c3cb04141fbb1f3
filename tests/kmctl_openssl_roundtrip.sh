#!/usr/bin/env bash
# kmctl and the openssl command line agree on RSA: a PKCS#8 key made by
# openssl is imported, kmctl's signatures verify with openssl, openssl's
# with kmctl, openssl's ciphertexts decrypt with kmctl, and the export is
# openssl's public key.
set -euo pipefail
kmctl=$1
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
cd "$work"
k() { "$kmctl" --state "$work/state" --log-level none "$@"; }

openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:2048 -out key.pem 2>/dev/null
openssl pkey -in key.pem -pubout -out pub.pem
head -c 70000 /dev/urandom > msg
head -c 100 /dev/urandom > pt

k import --algorithm rsa --padding rsa_pkcs1_1_5_sign,rsa_pss,rsa_oaep,rsa_pkcs1_1_5_encrypt \
  --digest sha_2_256,sha_2_512 --in key.pem --out key.blob

k sign --key key.blob --padding rsa_pkcs1_1_5_sign --digest sha256 --in msg --out sig
openssl dgst -sha256 -verify pub.pem -signature sig msg >/dev/null
k sign --key key.blob --padding rsa_pss --digest sha512 --in msg --out sig.pss
openssl dgst -sha512 -sigopt rsa_padding_mode:pss -sigopt rsa_pss_saltlen:-2 -verify pub.pem -signature sig.pss msg >/dev/null

openssl dgst -sha256 -sign key.pem -out theirs msg
k verify --key key.blob --padding rsa_pkcs1_1_5_sign --digest sha256 --in msg --signature theirs
printf x >> msg
if k verify --key key.blob --padding rsa_pkcs1_1_5_sign --digest sha256 --in msg --signature theirs 2>err; then
  echo "a changed message verified" >&2; exit 1
fi
grep -q KM_ERROR_VERIFICATION_FAILED err

openssl pkeyutl -encrypt -pubin -inkey pub.pem -pkeyopt rsa_padding_mode:oaep -pkeyopt rsa_oaep_md:sha256 \
  -pkeyopt rsa_mgf1_md:sha256 -in pt -out ct.oaep
k decrypt --key key.blob --padding rsa_oaep --digest sha256 --in ct.oaep --out pt.oaep
cmp pt pt.oaep
openssl pkeyutl -encrypt -pubin -inkey pub.pem -in pt -out ct.pkcs1
k decrypt --key key.blob --padding rsa_pkcs1_1_5_encrypt --in ct.pkcs1 --out pt.pkcs1
cmp pt pt.pkcs1

k export --key key.blob --out exported.pem
cmp <(openssl pkey -pubin -in exported.pem -outform DER) <(openssl pkey -pubin -in pub.pem -outform DER)
echo "round trip ok"
