#!/usr/bin/env bash
# make-test-certs.sh DIR - generates throw-away TLS material for the tests and the demonstration:
# a CA, a server certificate for the loopback addresses and a client certificate, all signed by the CA.
#   DIR/ca.pem DIR/ca.key  DIR/server.pem DIR/server.key  DIR/client.pem DIR/client.key
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

chmod 0644 ca.pem server.pem client.pem
