#!/usr/bin/env bash
# Makes the certificates of the HTTPS tests and the demo into DIR:
#   ca.pem/ca.key          the test CA (trusted in the prefix's machine Root store)
#   server.pem/server.key  a TLS server certificate for localhost, from the CA
#   device.pem/device.key  the device certificate (client authentication plus the device
#   device.pfx             usage), from the CA; the PFX's password is "telvane"
#   other.pfx              a client certificate without the device usage (same password)
#   rogue.pem/rogue.key    a CA nobody trusts, and roguesrv.pem/roguesrv.key, a localhost
#                          server certificate from it
# Usage: makepki.sh DIR
set -euo pipefail
dir=$1
device_usage=1.3.6.1.4.1.59871.20.1.1
mkdir -p "$dir"
cd "$dir"

ca() { # NAME SUBJECT
  openssl req -x509 -newkey rsa:2048 -nodes -keyout "$1.key" -out "$1.pem" -days 30 \
    -subj "/CN=$2" -addext basicConstraints=critical,CA:TRUE \
    -addext keyUsage=critical,keyCertSign,cRLSign 2>/dev/null
}

leaf() { # NAME ISSUER SUBJECT EXTENSIONS...
  local name=$1 issuer=$2 subject=$3
  shift 3
  printf '%s\n' "$@" > "$name.ext"
  openssl req -new -newkey rsa:2048 -nodes -keyout "$name.key" -out "$name.csr" \
    -subj "/CN=$subject" 2>/dev/null
  openssl x509 -req -in "$name.csr" -CA "$issuer.pem" -CAkey "$issuer.key" \
    -CAcreateserial -out "$name.pem" -days 30 -extfile "$name.ext" 2>/dev/null
  rm -f "$name.csr" "$name.ext"
}

pfx() { # NAME
  # SHA-1/3DES protection: what every PKCS#12 reader understands.
  openssl pkcs12 -export -in "$1.pem" -inkey "$1.key" -out "$1.pfx" -passout pass:telvane \
    -keypbe PBE-SHA1-3DES -certpbe PBE-SHA1-3DES -macalg sha1 -name "$1"
}

ca ca "Telvane Test CA"
leaf server ca localhost "subjectAltName=DNS:localhost" "extendedKeyUsage=serverAuth" \
  "keyUsage=critical,digitalSignature,keyEncipherment"
leaf device ca "Telvane Test Device" "extendedKeyUsage=clientAuth,$device_usage" \
  "keyUsage=critical,digitalSignature,keyEncipherment"
leaf other ca "Telvane Other Client" "extendedKeyUsage=clientAuth" \
  "keyUsage=critical,digitalSignature,keyEncipherment"
pfx device
pfx other
ca rogue "Telvane Rogue CA"
leaf roguesrv rogue localhost "subjectAltName=DNS:localhost" "extendedKeyUsage=serverAuth" \
  "keyUsage=critical,digitalSignature,keyEncipherment"
