#!/bin/sh
# The bare openssl command sequence of one certificate set, as the module
# runs it (same commands, same arguments, same configuration files), with
# nothing around it: the baseline of mkcert_bench.
#
#   openssl_set.sh DIR WORK BITS
#
# DIR receives the five files of the set; WORK holds the configuration
# files, requests and serial file. BITS is the length of both RSA keys, or
# "ec256" / "ec384" for EC keys of that curve (the commands of CRT create's
# "key_type" and "ca_key_type").
set -e
dir=$1
work=$2
bits=$3
ssl=/usr/bin/openssl

cat > "$work/ca.cfg" <<'CFG'
[ req ]
default_bits                    = 1024
distinguished_name              = req_DN
prompt                          = no
[ req_DN ]
countryName                     = 'TW'
localityName                    = 'Taipel'
0.organizationName              = 'Arvelon Inc.'
commonName                      = 'Arvelon Inc. CA'
CFG
sed "s/'Arvelon Inc. CA'/'arvelon'/" "$work/ca.cfg" > "$work/server.cfg"
cat > "$work/ca.crt.cfg" <<'CFG'
extensions = x509v3
[ x509v3 ]
subjectAltName   = email:copy
basicConstraints = CA:true,pathlen:0
nsComment        = "mod_ssl generated custom CA certificate"
nsCertType       = sslCA
CFG
cat > "$work/server.crt.cfg" <<'CFG'
extensions = x509v3
[ x509v3 ]
subjectAltName   = email:copy
nsComment        = "mod_ssl generated custom server certificate"
nsCertType       = server
keyUsage         = critical, digitalSignature, keyEncipherment
extendedKeyUsage = serverAuth, clientAuth
subjectAltName = "DNS:arvelon"
CFG
[ -f "$work/serial" ] || printf '%s' "$(date +%s)abcd" > "$work/serial"

digest=-sha256
case $bits in
  ec256|ec384)
    curve=P-${bits#ec}
    [ "$bits" = ec384 ] && digest=-sha384
    sed -i 's/, keyEncipherment$//' "$work/server.crt.cfg"
    genkey() { $ssl genpkey -algorithm EC -pkeyopt "ec_paramgen_curve:$curve" -out "$1" 2>/dev/null; }
    ;;
  *)
    genkey() { $ssl genrsa -rand /dev/urandom -out "$1" "$bits" 2>/dev/null; }
    ;;
esac

genkey "$dir/zeph-ca-privkey.pem"
$ssl req -config "$work/ca.cfg" -new $digest -key "$dir/zeph-ca-privkey.pem" \
  -out "$work/ca.csr" 2>/dev/null
$ssl x509 -extfile "$work/ca.crt.cfg" -days 366 -in "$work/ca.csr" -req \
  $digest -out "$dir/zeph-ca-cert.pem" -signkey "$dir/zeph-ca-privkey.pem" 2>/dev/null
genkey "$dir/privkey.pem"
$ssl req -config "$work/server.cfg" -new $digest -key "$dir/privkey.pem" \
  -out "$work/server.csr" 2>/dev/null
$ssl x509 -extfile "$work/server.crt.cfg" -days 366 -in "$work/server.csr" \
  -req $digest -out "$dir/cert.pem" -CAserial "$work/serial" \
  -CA "$dir/zeph-ca-cert.pem" -CAkey "$dir/zeph-ca-privkey.pem" 2>/dev/null
/bin/cp -f "$dir/cert.pem" "$dir/fullchain.pem"
