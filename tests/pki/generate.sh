#!/bin/sh
# Regenerates the development PKI in this directory with the openssl command:
#   general root (RSA-2048, sha1WithRSAEncryption) -> intermediate (the expected common
#     name, PrintableString) -> leaf, with and without the manifest-constraint extension
#   secure-boot root (RSA-4096, sha384WithRSAEncryption) -> leaf, with and without it
#   EC test root (P-256, ecdsa-with-SHA256) -> leaf
#   developer CA -> developer signing certificates (current, expired since, not yet
#     valid at the fixed verification instant) and a foreign CA with its own signer
#   an RSA key with a 513-byte modulus, for the key-size limit
# Every certificate is valid at 2014-04-10 22:55:30 UTC unless its name says otherwise.
# Private keys are for development only; production roots come from BRISVALE_ROOTS_DIR.
set -eu
cd "$(dirname "$0")"
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

# The manifest-constraint extension: a private OID with 10 content bytes
# (2B 06 01 04 01 83 BF 30 01 01), whose value is a SET holding one empty [PRIVATE "MANP"]
# constraint group: the leaf pins nothing, and the signing tool mints leaves that pin
# values when asked to.
constraint_oid=1.3.6.1.4.1.57264.1.1
constraint_value=3111ff84ea859c500a300816044d414e503100
expected_name="Brisvale Development Manifest Issuing CA1"

cat >"$work/openssl.cnf" <<CNF
[ca]
default_ca = dev_ca
[dev_ca]
dir = $work
database = $work/index.txt
new_certs_dir = $work/new
serial = $work/serial
policy = policy_anything
unique_subject = no
email_in_dn = no
copy_extensions = none
string_mask = default
[policy_anything]
commonName = supplied
organizationName = optional
organizationalUnitName = optional
countryName = optional
[req]
distinguished_name = req_dn
string_mask = default
prompt = no
[req_dn]
CN = unused
[root_ext]
basicConstraints = critical,CA:TRUE
keyUsage = critical,keyCertSign,cRLSign
subjectKeyIdentifier = hash
[intermediate_ext]
basicConstraints = critical,CA:TRUE
keyUsage = critical,keyCertSign,cRLSign,digitalSignature
subjectKeyIdentifier = hash
authorityKeyIdentifier = keyid
[leaf_ext]
basicConstraints = critical,CA:FALSE
keyUsage = critical,digitalSignature
[leaf_constrained_ext]
basicConstraints = critical,CA:FALSE
keyUsage = critical,digitalSignature
$constraint_oid = DER:$constraint_value
CNF
mkdir -p "$work/new"
: >"$work/index.txt"
echo 1000 >"$work/serial"

rsa_key() { openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:"$2" -out "$1.key" 2>/dev/null; }
ec_key() { openssl genpkey -algorithm EC -pkeyopt ec_paramgen_curve:P-256 -out "$1.key"; }

# issue NAME ISSUER DIGEST EXTENSIONS "SUBJECT" [START END]
# ISSUER "self" makes a self-signed certificate.
issue() {
  name=$1 issuer=$2 digest=$3 ext=$4 subject=$5
  start=${6:-20100101000000Z} end=${7:-20400101000000Z}
  openssl req -new -config "$work/openssl.cnf" -key "$name.key" -subj "$subject" \
    -out "$work/$name.csr"
  if [ "$issuer" = self ]; then
    set -- -selfsign -keyfile "$name.key"
  else
    set -- -cert "$issuer.pem" -keyfile "$issuer.key"
  fi
  openssl ca -batch -config "$work/openssl.cnf" -notext -md "$digest" -extensions "$ext" \
    -startdate "$start" -enddate "$end" -preserveDN "$@" \
    -in "$work/$name.csr" -out "$name.pem" 2>/dev/null
  openssl x509 -in "$name.pem" -outform DER -out "$name.der"
}

rsa_key general-root 2048
issue general-root self sha1 root_ext "/O=Brisvale Development/CN=Brisvale Development Root CA"
rsa_key general-intermediate 2048
issue general-intermediate general-root sha1 intermediate_ext "/CN=$expected_name"
rsa_key general-leaf 2048
issue general-leaf general-intermediate sha1 leaf_ext "/CN=Brisvale Development Manifest Signer"
cp general-leaf.key general-leaf-constrained.key
issue general-leaf-constrained general-intermediate sha1 leaf_constrained_ext \
  "/CN=Brisvale Development Manifest Signer"

rsa_key secure-root 4096
issue secure-root self sha384 root_ext "/O=Brisvale Development/CN=Brisvale Development Secure Boot Root CA"
rsa_key secure-leaf 4096
issue secure-leaf secure-root sha384 leaf_ext "/CN=Brisvale Development Secure Boot Signer"
cp secure-leaf.key secure-leaf-constrained.key
issue secure-leaf-constrained secure-root sha384 leaf_constrained_ext \
  "/CN=Brisvale Development Secure Boot Signer"

ec_key ec-root
issue ec-root self sha256 root_ext "/O=Brisvale Development/CN=Brisvale Local EC Root CA"
ec_key ec-leaf
issue ec-leaf ec-root sha256 leaf_ext "/CN=Brisvale Local EC Signer"

rsa_key developer-ca 2048
issue developer-ca self sha256 root_ext "/O=Brisvale Development/CN=Brisvale Developer CA"
rsa_key developer-signing 2048
issue developer-signing developer-ca sha256 leaf_ext "/CN=Brisvale Developer Image Signing"
cp developer-signing.key developer-signing-expired.key
issue developer-signing-expired developer-ca sha256 leaf_ext \
  "/CN=Brisvale Developer Image Signing (expired)" 20130101000000Z 20150101000000Z
cp developer-signing.key developer-signing-future.key
issue developer-signing-future developer-ca sha256 leaf_ext \
  "/CN=Brisvale Developer Image Signing (future)" 20150101000000Z 20400101000000Z
rsa_key foreign-ca 2048
issue foreign-ca self sha256 root_ext "/O=Elsewhere/CN=Foreign CA"
rsa_key foreign-signing 2048
issue foreign-signing foreign-ca sha256 leaf_ext "/CN=Foreign Image Signing"

openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:4104 -out rsa-4104.key 2>/dev/null

# Build-time data beside the roots: the expected name as a whole PrintableString
# element and the constraint OID's content bytes.
printf '\023\051%s' "$expected_name" >expected-intermediate-name.der
printf '\053\006\001\004\001\203\277\060\001\001' >manifest-constraint-oid.bin
