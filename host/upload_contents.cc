#include "host/upload_contents.h"

#include <fcntl.h>
#include <unistd.h>

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/pkcs12.h>

#include "zeph/fd_io.h"
#include "zeph/qlibc_exec.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace {

constexpr char kOpenssl[] = "/usr/bin/openssl";
// Wait, no descriptors but 0-2, standard streams on /dev/null, default
// signal handling.
constexpr int kQuietRun = 0xBB;

// The passphrase for OpenSSL's callbacks, and whether one was asked for
// (which tells an encrypted key from one that is merely unreadable).
struct Passphrase {
  const std::string* text;
  bool given;
  bool asked = false;
};

int PassphraseCallback(char* buf, int size, int /*rwflag*/, void* u) {
  Passphrase* p = static_cast<Passphrase*>(u);
  p->asked = true;
  if (!p->given || p->text->size() > static_cast<size_t>(size)) return -1;
  p->text->copy(buf, p->text->size());
  return static_cast<int>(p->text->size());
}

ssl::BioPtr MemoryBio(const std::string& bytes) {
  return ssl::BioPtr(BIO_new_mem_buf(bytes.data(), static_cast<int>(bytes.size())));
}

// Takes the certificates of a PKCS#7 bundle (a "certs-only" signed data).
void AddPkcs7Certs(PKCS7* p7, UploadContents& out) {
  if (p7 == nullptr || !PKCS7_type_is_signed(p7) || p7->d.sign == nullptr) return;
  STACK_OF(X509)* certs = p7->d.sign->cert;
  for (int i = 0; i < sk_X509_num(certs); ++i) {
    X509* c = sk_X509_value(certs, i);
    if (X509_up_ref(c) == 1) out.certs.emplace_back(c);
  }
}

// A private key from the PEM text of one block; records why it stayed
// closed.
void AddPemKey(const std::string& pem, const std::string& passphrase,
               bool has_passphrase, UploadContents& out) {
  ssl::BioPtr bio = MemoryBio(pem);
  Passphrase p{&passphrase, has_passphrase};
  EVP_PKEY* key =
      bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, PassphraseCallback, &p)
          : nullptr;
  if (key != nullptr) {
    out.keys.emplace_back(key);
  } else if (!p.asked) {
    out.lock = UploadContents::Lock::kUnreadable;
  } else {
    out.lock = has_passphrase ? UploadContents::Lock::kWrongPassphrase
                              : UploadContents::Lock::kNeedsPassphrase;
  }
}

bool IsKeyBlock(const std::string& name) {
  return name == "PRIVATE KEY" || name == "ENCRYPTED PRIVATE KEY" ||
         (name.size() > 12 &&
          name.compare(name.size() - 12, 12, " PRIVATE KEY") == 0);
}

// Every PEM block of `text`, sorted by kind. False when there is none.
bool ReadPem(const std::string& text, const std::string& passphrase,
             bool has_passphrase, UploadContents& out) {
  ssl::BioPtr bio = MemoryBio(text);
  bool any = false;
  for (;;) {
    char* name_raw = nullptr;
    char* header_raw = nullptr;
    unsigned char* data_raw = nullptr;
    long len = 0;
    if (!bio || PEM_read_bio(bio.get(), &name_raw, &header_raw, &data_raw, &len) != 1) {
      break;
    }
    ssl::OpensslChars name_owner(name_raw), header_owner(header_raw);
    ssl::OpensslBytes data_owner(data_raw);
    any = true;
    const std::string name = name_raw;
    const unsigned char* p = data_raw;
    if (name == "CERTIFICATE" || name == "X509 CERTIFICATE") {
      if (X509* c = d2i_X509(nullptr, &p, len)) out.certs.emplace_back(c);
    } else if (name == "TRUSTED CERTIFICATE") {
      if (X509* c = d2i_X509_AUX(nullptr, &p, len)) out.certs.emplace_back(c);
    } else if (name == "PKCS7") {
      ssl::Pkcs7Ptr p7(d2i_PKCS7(nullptr, &p, len));
      AddPkcs7Certs(p7.get(), out);
    } else if (name == "CERTIFICATE REQUEST" || name == "NEW CERTIFICATE REQUEST") {
      ++out.requests;
    } else if (IsKeyBlock(name)) {
      // The key readers want the block as PEM, headers and all (the
      // traditional encryption is announced in them).
      ssl::BioPtr one(BIO_new(BIO_s_mem()));
      char* pem = nullptr;
      if (one && PEM_write_bio(one.get(), name_raw, header_raw, data_raw, len) > 0) {
        const long n = BIO_get_mem_data(one.get(), &pem);
        AddPemKey(std::string(pem, static_cast<size_t>(n)), passphrase,
                  has_passphrase, out);
      }
    }
  }
  ERR_clear_error();  // the end of the text leaves "no start line"
  return any;
}

bool WriteSecretFile(const std::string& path, const std::string& bytes) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW,
                   0600));
  return fd && WriteAll(fd.get(), bytes) && close(fd.release()) == 0;
}

// Opens a PKCS#12 bundle with the system's openssl into PEM, and reads
// that. The passphrase has been checked against the bundle's MAC.
void OpenPkcs12(const std::string& bytes, const std::string& passphrase,
                const std::string& scratch_dir, UploadContents& out) {
  const std::string bundle = scratch_dir + "/.bundle.p12";
  const std::string pass_file = scratch_dir + "/.bundle.pass";
  const std::string pem = scratch_dir + "/.bundle.pem";
  std::string pem_text;
  if (WriteSecretFile(bundle, bytes) &&
      (passphrase.empty() || WriteSecretFile(pass_file, passphrase + "\n"))) {
    const std::string passin =
        passphrase.empty() ? "pass:" : "file:" + pass_file;
    // Bundles of older systems use algorithms that only openssl's legacy
    // provider reads.
    for (const char* legacy : {static_cast<const char*>(nullptr), "-legacy"}) {
      unlink(pem.c_str());
      if (QLIBCExecl(kOpenssl, kQuietRun, "pkcs12", "-in", bundle.c_str(),
                     "-nodes", "-passin", passin.c_str(), "-out", pem.c_str(),
                     legacy, nullptr) == 0) {
        UniqueFd fd(open(pem.c_str(), O_RDONLY | O_CLOEXEC));
        if (fd) ReadAll(fd.get(), pem_text);
        break;
      }
    }
  }
  for (const std::string& f : {bundle, pass_file, pem}) unlink(f.c_str());
  if (!ReadPem(pem_text, "", false, out)) {
    out.lock = UploadContents::Lock::kUnreadable;
  }
}

// A PKCS#12 bundle: its MAC tells whether the passphrase is right.
void ReadPkcs12(PKCS12* p12, const std::string& bytes, const std::string& passphrase,
                bool has_passphrase, const std::string& scratch_dir,
                UploadContents& out) {
  out.format = UploadContents::Format::kPkcs12;
  std::string pass = passphrase;
  if (PKCS12_mac_present(p12)) {
    if (has_passphrase) {
      if (PKCS12_verify_mac(p12, pass.c_str(), -1) != 1) {
        out.lock = UploadContents::Lock::kWrongPassphrase;
        return;
      }
    } else if (PKCS12_verify_mac(p12, "", 0) == 1 ||
               PKCS12_verify_mac(p12, nullptr, 0) == 1) {
      pass.clear();
    } else {
      out.lock = UploadContents::Lock::kNeedsPassphrase;
      return;
    }
  }
  OpenPkcs12(bytes, pass, scratch_dir, out);
}

void ReadDer(const std::string& bytes, const std::string& passphrase,
             bool has_passphrase, const std::string& scratch_dir,
             UploadContents& out) {
  auto at = [&bytes](const unsigned char** p) {
    *p = reinterpret_cast<const unsigned char*>(bytes.data());
    return static_cast<long>(bytes.size());
  };
  auto whole = [&bytes](const unsigned char* p) {
    return p == reinterpret_cast<const unsigned char*>(bytes.data()) + bytes.size();
  };
  const unsigned char* p = nullptr;
  long len = at(&p);
  if (ssl::Pkcs12Ptr p12{d2i_PKCS12(nullptr, &p, len)}; p12 && whole(p)) {
    ReadPkcs12(p12.get(), bytes, passphrase, has_passphrase, scratch_dir, out);
    return;
  }
  out.format = UploadContents::Format::kDer;
  len = at(&p);
  if (ssl::X509Ptr c{d2i_X509(nullptr, &p, len)}; c && whole(p)) {
    out.certs.push_back(std::move(c));
    return;
  }
  len = at(&p);
  if (ssl::Pkcs7Ptr p7{d2i_PKCS7(nullptr, &p, len)}; p7 && whole(p)) {
    AddPkcs7Certs(p7.get(), out);
    return;
  }
  len = at(&p);
  if (ssl::X509ReqPtr r{d2i_X509_REQ(nullptr, &p, len)}; r && whole(p)) {
    ++out.requests;
    return;
  }
  len = at(&p);
  if (EVP_PKEY* k = d2i_AutoPrivateKey(nullptr, &p, len); k != nullptr) {
    out.keys.emplace_back(k);
    return;
  }
  // An encrypted PKCS#8 key.
  len = at(&p);
  if (X509_SIG* sig = d2i_X509_SIG(nullptr, &p, len); sig != nullptr) {
    X509_SIG_free(sig);
    ssl::BioPtr bio = MemoryBio(bytes);
    Passphrase pp{&passphrase, has_passphrase};
    EVP_PKEY* key = bio ? d2i_PKCS8PrivateKey_bio(bio.get(), nullptr,
                                                  PassphraseCallback, &pp)
                        : nullptr;
    if (key != nullptr) {
      out.keys.emplace_back(key);
    } else {
      out.lock = has_passphrase ? UploadContents::Lock::kWrongPassphrase
                                : UploadContents::Lock::kNeedsPassphrase;
    }
    return;
  }
  out.format = UploadContents::Format::kUnknown;
}

}  // namespace

UploadContents ReadUpload(const std::string& bytes, const std::string& passphrase,
                          bool has_passphrase, const std::string& scratch_dir) {
  UploadContents out;
  std::string text = bytes;
  if (text.compare(0, 3, "\xEF\xBB\xBF") == 0) text.erase(0, 3);
  if (text.find_first_not_of(" \t\r\n") == std::string::npos) return out;
  if (text.find("-----BEGIN ") != std::string::npos) {
    std::string lf;
    lf.reserve(text.size());
    for (char c : text) {
      if (c != '\r') lf.push_back(c);
    }
    out.format = ReadPem(lf, passphrase, has_passphrase, out)
                     ? UploadContents::Format::kPem
                     : UploadContents::Format::kUnknown;
  } else {
    ReadDer(bytes, passphrase, has_passphrase, scratch_dir, out);
  }
  ERR_clear_error();
  return out;
}

}  // namespace ZEPH
