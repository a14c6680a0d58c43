// Keys, certificate signing requests, certificates and the serial file
// of the appliance's own certificate authority.
//
// Everything is made by running "/usr/bin/openssl" directly (no shell) with
// fixed argument vectors and waiting for it; the tool's output is not read.
// Every key, request and certificate made here is chmod 0400. Functions
// return 0 on success and -1 on failure, logging one line (source "mkcert")
// for the step that failed. Nothing is rolled back: files of earlier steps
// stay on disk.
//
// Paths given by the caller are used as they are; the fixed working files
// (extension files, the authority's request, the serial file, the address
// file) are taken below the root prefix (ZEPH_ROOT).
//
// An output file is removed before the run that makes it (earlier products
// are mode 0400, which openssl cannot write over unless it runs as root)
// and again when the run fails, so that a failed run leaves no empty or
// partial product behind.
//
// Thread-safety: no state is kept in memory and no lock is taken. The fixed
// working files are shared by every caller, so callers hold the generation
// lock (generation_lock.h) while they use them.
#ifndef ZEPH_MODULE_MKCERT_GENERATE_H_
#define ZEPH_MODULE_MKCERT_GENERATE_H_

#include <string>

#include "module/mkcert/config_files.h"
#include "module/mkcert/csr_argument.h"
#include "module/mkcert/key_type.h"
#include "zeph/export.h"

// Makes an RSA private key of `bits` bits in PEM at `keyPath`:
//   openssl genrsa -rand /dev/urandom -out KEY BITS
// The parent directory is made when missing. An empty path, bits 0 or more
// than kMaxKeyBits is refused before anything runs.
ZEPH_EXPORT int genKey(const std::string& keyPath, unsigned int bits);

// The longest RSA key genKey makes; longer ones are refused like 0 bits.
constexpr unsigned int kMaxKeyBits = 16384;

// Makes a private key of `type` in PEM at `keyPath`: for kRsa exactly
// genKey(keyPath, bits); for an EC type (`bits` is not used)
//   openssl genpkey -algorithm EC -pkeyopt ec_paramgen_curve:P-256 -out KEY
// (P-384 for kEc384), with genKey's checks, messages and mode 0400.
ZEPH_EXPORT int genKeyOfType(const std::string& keyPath,
                             ZEPH::cert::KeyType type, unsigned int bits);

// Writes the request configuration for `subject` at `cfgPath` and makes the
// request at `csrPath`, signed with the existing key at `keyPath`:
//   openssl req -config CFG -new -sha256 -key KEY -out CSR [-utf8]
// (-sha384 instead for a P-384 key, see key_type.h). -utf8 is added when a subject value is not plain ASCII, so that UTF-8
// values are stored as they are. Values with line breaks or bytes that are
// not UTF-8 are refused (modifyCsrCfg).
// REQUIRES: the three paths are non-empty, subject is not null, the key
// exists (each refused with a log line otherwise).
ZEPH_EXPORT int genCsr(const std::string& cfgPath, const std::string& keyPath,
                       const std::string& csrPath, _tag_CSR_ARGUMENT* subject);

// Turns the request at `csrPath` into a certificate valid for `days` days.
//   selfSign:  signs it with `keyPath` itself into `caCrtPath`, with the
//              authority's extension file written at `cfgPath`;
//   otherwise: signs it with the authority certificate `caCrtPath` and its
//              key `keyPath` into `outPath`, taking the serial number from
//              `serialPath` (which must exist; the tool advances it), with
//              a server extension file at `cfgPath` naming the ";"-separated
//              `aliases` as subject alternative names. The tool signs with
//              the number after the one in the serial file and writes the
//              number it used back (uppercase, with a line feed).
// The signature's digest follows `keyPath` as in genCsr (-sha256 for RSA).
// The extension file is written before the run, but a failure to write it
// does not stop the run: the tool then fails or uses what the file holds.
// REQUIRES: cfgPath, csrPath, caCrtPath, keyPath non-empty, days >= 1, and
// for authority signing serialPath and outPath non-empty.
ZEPH_EXPORT int genCrt(const std::string& cfgPath, const std::string& csrPath,
                       const std::string& caCrtPath,
                       const std::string& serialPath,
                       const std::string& outPath, const std::string& keyPath,
                       bool selfSign, int days, const std::string& aliases);

// Signs the server request `csrPath` with the authority (`caCrtPath`,
// `caKeyPath`) into `outPath`, with the appliance's server extension file
// and serial file; a missing serial file is made first (genSerial).
ZEPH_EXPORT int genServerCrt(const std::string& csrPath,
                             const std::string& caCrtPath,
                             const std::string& outPath,
                             const std::string& caKeyPath, int days,
                             const std::string& aliases);

// As genServerCrt, with the keyUsage line of `usage` in the server
// extension file (config_files.h); kSignatureAndEncipherment is genServerCrt.
ZEPH_EXPORT int genServerCrt(const std::string& csrPath,
                             const std::string& caCrtPath,
                             const std::string& outPath,
                             const std::string& caKeyPath, int days,
                             const std::string& aliases,
                             ZEPH::cert::ServerKeyUsage usage);

// Self-signs the authority's request (the appliance's fixed "ca.csr") with
// `caKeyPath` into `caCrtPath`, valid for 366 days, with the CA extensions.
ZEPH_EXPORT int genCACrt(const std::string& caCrtPath,
                         const std::string& caKeyPath);

// Writes a fresh serial file: the current time in decimal seconds followed
// by the appliance's address text from its ninth character on, read as one
// hexadecimal number by the tool; a "1" is appended when the digit count is
// odd, since the tool wants whole bytes. The file has no line end. The
// first certificate signed with it gets that number plus one.
ZEPH_EXPORT int genSerial();

#endif  // ZEPH_MODULE_MKCERT_GENERATE_H_
