#!/usr/bin/env bash
# kmctl as a newcomer meets it: outputs to special files, messages with
# their reasons, keys in every form openssl writes, errors as sentences
# with the right exit codes, the documented defaults, delete, --version.
# Each check runs the built kmctl and asserts its exit code and the first
# words of its message.
# Usage: kmctl_newcomer.sh KMCTL VERSION
set -uo pipefail
kmctl=$(realpath "$1") version=$2
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
cd "$work"
failures=0
fail() {
  echo "FAIL: $*" >&2
  failures=$((failures + 1))
}
st=$work/state
k() { "$kmctl" --state "$st" --log-level none "$@"; }

# expect CODE PREFIX -- ARGS: kmctl ARGS exits CODE and its stderr's first
# line starts with PREFIX (empty: nothing is asked of stderr).
expect() {
  local code=$1 prefix=$2
  shift 3
  "$kmctl" --log-level none "$@" >out 2>err
  local got=$?
  [ "$got" = "$code" ] || fail "kmctl $*: exit $got, expected $code: $(cat err)"
  if [ -n "$prefix" ]; then
    local first
    first=$(head -n 1 err)
    [[ "$first" == "$prefix"* ]] || fail "kmctl $*: message '$first', expected '$prefix...'"
  fi
}

# ---- first run, version, the state directory ----
out=$("$kmctl" --version) || fail "--version failed"
[ "$out" = "kmctl $version" ] || fail "--version printed '$out'"
k generate --algorithm hmac --out h.blob 2>err || fail "first generate: $(cat err)"
grep -qx "kmctl: created the state directory $st" err || fail "first run did not name the state directory: $(cat err)"
k generate --algorithm hmac --out h2.blob 2>err || fail "second generate"
[ ! -s err ] || fail "second run printed: $(cat err)"
expect 2 "" -- --state "" info

# ---- outputs ----
printf 'hello' >msg
k sign --key h.blob --in msg --out mac || fail "sign to a file"
mkfifo fifo
timeout 60 cat fifo >from_fifo &
reader=$!
k sign --key h.blob --in msg --out fifo || fail "sign to a FIFO"
wait $reader
cmp -s mac from_fifo || fail "the FIFO's reader did not get the MAC"
[ -p fifo ] || fail "the FIFO was replaced"

echo old >target
ln -s target link
k sign --key h.blob --in msg --out link || fail "sign through a symlink"
[ -L link ] || fail "the symlink was replaced"
cmp -s mac target || fail "the symlink's target does not hold the MAC"

k sign --key h.blob --in msg --out /dev/null || fail "sign to /dev/null"
[ -c /dev/null ] || fail "/dev/null is no longer a device"
expect 4 "cannot write /dev/full: No space left on device" -- --state "$st" sign --key h.blob --in msg --out /dev/full
[ -c /dev/full ] || fail "/dev/full is no longer a device"
if [ "$(id -u)" = 0 ]; then
  mknod null c 1 3
  k sign --key h.blob --in msg --out null || fail "sign to a character device"
  [ -c null ] || fail "the character device was replaced by a file"
else
  echo "skipped: the character device under the test directory (needs root)"
fi
k sign --key h.blob --in msg --out /dev/stdout >stdout_mac || fail "sign to /dev/stdout"
cmp -s mac stdout_mac || fail "/dev/stdout did not get the MAC"

mkdir adir
expect 4 "cannot write adir: it is a directory" -- --state "$st" sign --key h.blob --in msg --out adir
expect 4 "cannot read adir: it is a directory" -- --state "$st" sign --key h.blob --in adir --out x
expect 4 "cannot read missing: No such file or directory" -- --state "$st" sign --key missing --in msg --out x
grep -q basic_filebuf err && fail "library text reached the user"

# A failed command leaves the existing output as it was, and nothing beside it.
cp mac kept
expect 1 "" -- --state "$st" verify --key h.blob --in msg --signature <(printf 'x%.0s' $(seq 32))
expect 2 "" -- --state "$st" sign --key h.blob --mac-length 100 --in msg --out kept
cmp -s mac kept || fail "a failed sign changed its output file"
ls -a | grep -q '\.tmp\.' && fail "a temporary file was left: $(ls -a)"

# ---- key formats: what openssl writes by default ----
openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:2048 -out pkcs8.pem 2>/dev/null
openssl pkey -in pkcs8.pem -outform DER -out pkcs8.der
openssl pkey -in pkcs8.pem -traditional -out trad.pem
openssl rsa -in pkcs8.pem -traditional -outform DER -out trad.der 2>/dev/null
openssl pkey -in pkcs8.pem -aes256 -passout pass:secret -out enc.pem
openssl pkey -in pkcs8.pem -pubout -out pub.pem
grep -q 'BEGIN RSA PRIVATE KEY' trad.pem || fail "openssl wrote no traditional PEM key"
# PKCS#1 DER: the version is followed by the modulus, not an algorithm identifier.
openssl asn1parse -inform DER -in trad.der | sed -n 3p | grep -q INTEGER || fail "openssl wrote no PKCS#1 DER key"
printf 'secret\n' >pass.txt
export KMCTL_TEST_PASS=secret
i=0
for form in "pkcs8.pem" "pkcs8.der" "trad.pem" "trad.der" "enc.pem --passin pass:secret" \
  "enc.pem --passin env:KMCTL_TEST_PASS" "enc.pem --passin file:pass.txt" "enc.pem --passin fd:3"; do
  i=$((i + 1))
  # shellcheck disable=SC2086
  k import --algorithm RSA --purpose sign --in $form --out "imp$i.blob" 3<pass.txt 2>err ||
    fail "import $form: $(cat err)"
  k sign --key "imp$i.blob" --padding RSA_PKCS1_1_5_SIGN --in msg --out "sig$i" ||
    fail "sign with the key imported from $form"
  openssl dgst -sha256 -verify pub.pem -signature "sig$i" msg >/dev/null || fail "openssl rejects the signature ($form)"
done
expect 2 "--in: the passphrase does not decrypt the key" -- --state "$st" import --algorithm rsa --in enc.pem \
  --passin pass:wrong --out x
expect 2 "--in: the key is encrypted: give its passphrase with --passin" -- --state "$st" import --algorithm rsa \
  --in enc.pem --out x </dev/null
expect 2 "--passin: expected pass:TEXT" -- --state "$st" import --algorithm rsa --in enc.pem --passin secret --out x
k export --key imp1.blob --format DER --out exported.der || fail "export --format DER"
cmp -s exported.der <(openssl pkey -pubin -in pub.pem -outform DER) || fail "the DER export is not the public key"

# ---- errors: user mistakes are not TEE failures ----
expect 2 "--size: an RSA key is 512 to 8192 bits" -- --state "$st" generate --algorithm rsa --size 0 --out x
expect 2 "--exponent: an RSA public exponent is odd" -- --state "$st" generate --algorithm rsa --exponent 4 --out x
head -c 20 h.blob >truncated.blob
expect 1 "KM_ERROR_INVALID_KEY_BLOB" -- --state "$st" sign --key truncated.blob --in msg --out x
cp h.blob tampered.blob
printf '\x55' | dd of=tampered.blob bs=1 seek=40 conv=notrunc 2>/dev/null
expect 1 "the key blob is damaged or was made with another state directory" -- --state "$st" sign \
  --key tampered.blob --in msg --out x
"$kmctl" --state "$work/other" info >/dev/null 2>&1 || fail "info on a second state directory"
expect 1 "the key blob is damaged or was made with another state directory" -- --state "$work/other" sign \
  --key h.blob --in msg --out x

# ---- MAC lengths ----
expect 2 "--mac-length: a whole number of bytes" -- --state "$st" sign --key h.blob --mac-length 100 --in msg --out x
expect 2 "--mac-length: at most the digest's 256 bits" -- --state "$st" sign --key h.blob --mac-length 264 --in msg \
  --out x
cat mac mac >long_mac
expect 1 "KM_ERROR_VERIFICATION_FAILED (-30)" -- --state "$st" verify --key h.blob --in msg --signature long_mac

# ---- defaults ----
k characteristics --key h.blob >chars || fail "characteristics"
grep -q '^KM_TAG_DIGEST *sha_2_256$' chars || fail "HMAC default digest: $(cat chars)"
grep -q '^KM_TAG_MIN_MAC_LENGTH *256$' chars || fail "HMAC default minimum MAC length: $(cat chars)"
k generate --algorithm rsa --out rsa.blob || fail "RSA generate with defaults"
k characteristics --key rsa.blob >chars
grep -q '^KM_TAG_KEY_SIZE *2048$' chars || fail "RSA default size: $(cat chars)"
grep -q '^KM_TAG_PADDING *rsa_pss, rsa_pkcs1_1_5_sign, rsa_oaep$' chars || fail "RSA default paddings: $(cat chars)"
expect 2 "sign needs --padding: the key allows rsa_pss, rsa_pkcs1_1_5_sign" -- --state "$st" sign --key rsa.blob \
  --in msg --out x
k sign --key rsa.blob --padding rsa_pss --in msg --out rsa.sig || fail "sign with the default RSA key"
expect 2 "an AES key needs --block-mode" -- --state "$st" generate --algorithm aes --size 128 --out x
"$kmctl" sign --help >help
grep -q rsa_pss help || fail "sign --help lacks rsa_pss"
grep -q rsa_oaep help && fail "sign --help lists an encryption padding"
"$kmctl" encrypt --help | grep -q rsa_pss && fail "encrypt --help lists a signing padding"

# Public-key encryption takes any padding, with a warning when the key's
# decryption will refuse it.
k generate --algorithm rsa --purpose encrypt,decrypt --out enc.blob
k encrypt --key enc.blob --padding rsa_pkcs1_1_5_encrypt --in msg --out ct 2>err || fail "encrypt: $(cat err)"
grep -q "^kmctl: warning: the key's decryption refuses padding rsa_pkcs1_1_5_encrypt" err ||
  fail "no warning for a padding the key cannot decrypt: $(cat err)"
k encrypt --key enc.blob --in msg --out ct 2>err || fail "encrypt with the key's padding"
[ ! -s err ] || fail "a warning for the key's own padding: $(cat err)"
k decrypt --key enc.blob --in ct --out pt && cmp -s msg pt || fail "decrypt with the key's own padding"

# ---- delete ----
cp h2.blob keep.blob
k delete --key keep.blob --keep-file || fail "delete --keep-file"
[ -f keep.blob ] || fail "--keep-file removed the blob"
k delete --key h2.blob || fail "delete --key"
[ ! -e h2.blob ] || fail "delete left the blob file"
expect 2 "" -- --state "$st" delete --all --keep-file

if [ $failures -gt 0 ]; then
  echo "$failures check(s) failed" >&2
  exit 1
fi
echo "newcomer path ok"
