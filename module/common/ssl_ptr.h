// Owning pointers for OpenSSL objects, one alias per type.
//
// Never call a *_free function by hand: wrap the object as soon as it is
// made and let the owner free it on every path.
#ifndef ZEPH_MODULE_COMMON_SSL_PTR_H_
#define ZEPH_MODULE_COMMON_SSL_PTR_H_

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/pkcs12.h>
#include <openssl/pkcs7.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <memory>

namespace ZEPH {
namespace ssl {

template <typename T, void (*Free)(T*)>
struct Deleter {
  void operator()(T* p) const {
    if (p != nullptr) Free(p);
  }
};

inline void FreeBio(BIO* b) { BIO_free(b); }
inline void FreeGeneralNames(GENERAL_NAMES* n) { GENERAL_NAMES_free(n); }
inline void FreeX509Stack(STACK_OF(X509)* s) { sk_X509_pop_free(s, X509_free); }

using BioPtr = std::unique_ptr<BIO, Deleter<BIO, FreeBio>>;
using Asn1TimePtr = std::unique_ptr<ASN1_TIME, Deleter<ASN1_TIME, ASN1_TIME_free>>;
using BignumPtr = std::unique_ptr<BIGNUM, Deleter<BIGNUM, BN_free>>;
using X509Ptr = std::unique_ptr<X509, Deleter<X509, X509_free>>;
using X509ReqPtr = std::unique_ptr<X509_REQ, Deleter<X509_REQ, X509_REQ_free>>;
using EvpPkeyPtr = std::unique_ptr<EVP_PKEY, Deleter<EVP_PKEY, EVP_PKEY_free>>;
using Pkcs7Ptr = std::unique_ptr<PKCS7, Deleter<PKCS7, PKCS7_free>>;
using Pkcs12Ptr = std::unique_ptr<PKCS12, Deleter<PKCS12, PKCS12_free>>;
using EvpPkeyCtxPtr =
    std::unique_ptr<EVP_PKEY_CTX, Deleter<EVP_PKEY_CTX, EVP_PKEY_CTX_free>>;
using EvpMdCtxPtr = std::unique_ptr<EVP_MD_CTX, Deleter<EVP_MD_CTX, EVP_MD_CTX_free>>;
using EcdsaSigPtr = std::unique_ptr<ECDSA_SIG, Deleter<ECDSA_SIG, ECDSA_SIG_free>>;
using GeneralNamesPtr =
    std::unique_ptr<GENERAL_NAMES, Deleter<GENERAL_NAMES, FreeGeneralNames>>;
using X509StackPtr =
    std::unique_ptr<STACK_OF(X509), Deleter<STACK_OF(X509), FreeX509Stack>>;

// OPENSSL_free is a macro; this frees buffers that OpenSSL allocated.
struct OpensslFree {
  void operator()(void* p) const { OPENSSL_free(p); }
};
using OpensslBytes = std::unique_ptr<unsigned char, OpensslFree>;
using OpensslChars = std::unique_ptr<char, OpensslFree>;

}  // namespace ssl
}  // namespace ZEPH

#endif  // ZEPH_MODULE_COMMON_SSL_PTR_H_
