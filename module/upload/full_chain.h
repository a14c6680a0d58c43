// The full-chain file of an imported certificate directory.
//
// "fullchain.pem" is what servers present: the certificate followed by its
// intermediate certificates. Uploaded files often lack the line feed after
// their last line; joined byte for byte, the intermediate's "-----BEGIN"
// would then be glued to the certificate's "-----END" line and the chain
// could not be read. The builder ends every file it copies with a line feed.
//
// Thread-safety: keeps no state; safe from any thread as long as nobody else
// writes the directory.
#ifndef ZEPH_MODULE_UPLOAD_FULL_CHAIN_H_
#define ZEPH_MODULE_UPLOAD_FULL_CHAIN_H_

#include <string>

// Writes `workDir`/"fullchain.pem": the lines of `workDir`/"cert.pem", then,
// when `workDir`/"chain.pem" exists, those of it; a file whose last line has
// no line feed gets one. Line endings are otherwise kept as they are (CRLF
// stays CRLF). The result is mode 0400.
// True on success. False with a log line when a file cannot be opened
// ("Open CA file failed"), read or written ("fputc error.") or the result
// cannot be made read-only ("Failed to chmod"); a partly written
// "fullchain.pem" may then be left for the caller to remove.
bool genChainCRT(const std::string& workDir);

#endif  // ZEPH_MODULE_UPLOAD_FULL_CHAIN_H_
