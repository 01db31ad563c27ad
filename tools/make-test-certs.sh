#!/usr/bin/env bash
# make-test-certs.sh DIR - generates throw-away TLS material for the tests and the demonstration:
# a CA, a server certificate for the loopback addresses and a client certificate, all signed by the CA,
# and server certificates a client must refuse or may take:
#   DIR/ca.pem DIR/ca.key  DIR/server.pem DIR/server.key  DIR/client.pem DIR/client.key
#   DIR/selfsigned.*  (not signed by the CA)  DIR/expired.*  (signed, but its time is over)
#   DIR/nosan.*  (signed, names no address: fine for a server reached by its literal address)
# Keys are written mode 0600 and belong in DIR only: never commit them.
set -euo pipefail

if [ $# -ne 1 ]; then
    echo "usage: $0 DIR" >&2
    exit 2
fi
dir=$1
mkdir -p "$dir"
cd "$dir"
umask 077

days=30
bits=2048
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

# openssl chatters on standard error even when it succeeds: show its output only when it fails.
quiet() {
    "$@" 2>"$work/stderr" || { cat "$work/stderr" >&2; exit 1; }
}

# The client reads its key as a PEM RSA key, so every key is written in the traditional RSA form.
new_key() {
    quiet openssl genrsa -traditional -out "$1" "$bits"
}

new_key ca.key
quiet openssl req -new -x509 -sha256 -days "$days" -key ca.key -subj "/O=kest-iam tests/CN=kest-test-ca" \
    -addext "basicConstraints=critical,CA:TRUE" -addext "keyUsage=critical,keyCertSign,cRLSign" -out ca.pem

sign() { # sign NAME SUBJECT EXTENSIONS
    new_key "$1.key"
    quiet openssl req -new -sha256 -key "$1.key" -subj "$2" -out "$work/$1.csr"
    printf '%s\n' "$3" >"$work/$1.ext"
    quiet openssl x509 -req -sha256 -days "$days" -in "$work/$1.csr" -CA ca.pem -CAkey ca.key \
        -set_serial "0x$(openssl rand -hex 8)" -extfile "$work/$1.ext" -out "$1.pem"
}

sign server "/O=kest-iam tests/CN=kest-test-domain-server" \
    "basicConstraints=CA:FALSE
keyUsage=critical,digitalSignature,keyEncipherment
extendedKeyUsage=serverAuth
subjectAltName=IP:127.0.0.2,IP:127.0.0.1,DNS:localhost"

sign client "/O=kest-iam tests/CN=kest-test-client" \
    "basicConstraints=CA:FALSE
keyUsage=critical,digitalSignature,keyEncipherment
extendedKeyUsage=clientAuth"

server_ext="basicConstraints=CA:FALSE
keyUsage=critical,digitalSignature,keyEncipherment
extendedKeyUsage=serverAuth"
sign nosan "/O=kest-iam tests/CN=kest-test-nosan" "$server_ext"

new_key selfsigned.key
quiet openssl req -new -x509 -sha256 -days "$days" -key selfsigned.key -subj "/O=kest-iam tests/CN=kest-test-domain-server" \
    -addext "subjectAltName=IP:127.0.0.2,IP:127.0.0.1,DNS:localhost" -out selfsigned.pem

# "openssl ca" is the one signer that takes dates in the past.
new_key expired.key
quiet openssl req -new -sha256 -key expired.key -subj "/O=kest-iam tests/CN=kest-test-domain-server" -out "$work/expired.csr"
touch "$work/index.txt"
openssl rand -hex 8 >"$work/serial"
cat >"$work/ca.cnf" <<EOF
[ca]
default_ca = test
[test]
database = $work/index.txt
new_certs_dir = $work
serial = $work/serial
policy = anything
default_md = sha256
x509_extensions = server
[anything]
commonName = supplied
[server]
$server_ext
subjectAltName=IP:127.0.0.2,IP:127.0.0.1,DNS:localhost
EOF
quiet openssl ca -batch -config "$work/ca.cnf" -cert ca.pem -keyfile ca.key -startdate 20200101000000Z \
    -enddate 20200201000000Z -notext -in "$work/expired.csr" -out expired.pem

chmod 0644 ca.pem server.pem client.pem nosan.pem selfsigned.pem expired.pem
