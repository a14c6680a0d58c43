#include "server/tls_identity.h"

#include <gtest/gtest.h>
#include <openssl/err.h>
#include <unistd.h>

#include <vector>

#include "test_support.h"
#include "tls_test_support.h"

namespace {

using ZEPH::test::ClientContext;
using ZEPH::test::MakeCertSet;
using ZEPH::test::PemFingerprint;
using ZEPH::test::SslCtxPtr;
using ZEPH::test::SslPtr;
using ZEPH::test::TempRoot;
using ZEPH::webapid::TlsIdentity;

// One client and one server connection joined by a memory BIO pair.
struct Handshake {
  SslPtr client, server;
  bool done = false;
};

Handshake Connect(SSL_CTX* server_ctx, SSL_CTX* client_ctx) {
  Handshake h;
  h.client.reset(SSL_new(client_ctx));
  h.server.reset(SSL_new(server_ctx));
  BIO* a = nullptr;
  BIO* b = nullptr;
  if (!h.client || !h.server || BIO_new_bio_pair(&a, 0, &b, 0) != 1) return h;
  SSL_set_bio(h.client.get(), a, a);
  SSL_set_bio(h.server.get(), b, b);
  SSL_set_connect_state(h.client.get());
  SSL_set_accept_state(h.server.get());
  for (int round = 0; round < 20 && !h.done; ++round) {
    const int c = SSL_do_handshake(h.client.get());
    const int s = SSL_do_handshake(h.server.get());
    h.done = c == 1 && s == 1;
    const int ce = SSL_get_error(h.client.get(), c);
    const int se = SSL_get_error(h.server.get(), s);
    if ((c != 1 && ce != SSL_ERROR_WANT_READ) ||
        (s != 1 && se != SSL_ERROR_WANT_READ)) {
      break;
    }
  }
  ERR_clear_error();
  return h;
}

std::string ServedFingerprint(const Handshake& h) {
  std::unique_ptr<X509, void (*)(X509*)> cert(
      SSL_get1_peer_certificate(h.client.get()), X509_free);
  return ZEPH::test::CertFingerprint(cert.get());
}

// What `openssl x509 -fingerprint -sha256` says, without the label.
std::string ToolFingerprint(const std::string& pem) {
  std::string out = ZEPH::test::Run({"/usr/bin/openssl", "x509", "-in", pem,
                                     "-noout", "-fingerprint", "-sha256"})
                        .out;
  out = out.substr(out.find('=') + 1);
  while (!out.empty() && out.back() == '\n') out.pop_back();
  return out;
}

class TlsIdentityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = root_.Path("/service");
    ASSERT_TRUE(MakeCertSet(dir_, "first.example"));
    ASSERT_TRUE(MakeCertSet(root_.Path("/second"), "second.example"));
  }
  // Replaces the service directory the way a deployment does: a new
  // directory renamed onto the old one.
  void Deploy(const std::string& from) {
    ASSERT_EQ(
        ZEPH::test::Run({"/bin/sh", "-c",
                         "rm -rf '" + dir_ + ".temp' && cp -r '" + from +
                             "' '" + dir_ + ".temp' && rm -rf '" + dir_ +
                             "' && mv '" + dir_ + ".temp' '" + dir_ + "'"})
            .status,
        0);
  }
  SslCtxPtr ServerContext(TlsIdentity& identity) {
    SslCtxPtr ctx(SSL_CTX_new(TLS_server_method()));
    EXPECT_TRUE(ctx && identity.Configure(ctx.get()));
    return ctx;
  }

  TempRoot root_;
  std::string dir_;
  std::vector<std::string> log_;
};

TEST_F(TlsIdentityTest, HandshakesPresentTheLoadedLeafAndItsChain) {
  TlsIdentity identity(dir_,
                       [this](const std::string& l) { log_.push_back(l); });
  std::string error;
  ASSERT_TRUE(identity.Load(&error)) << error;
  EXPECT_EQ(identity.Fingerprint(), ToolFingerprint(dir_ + "/cert.pem"));
  EXPECT_NE(identity.NotAfter().find("GMT"), std::string::npos)
      << identity.NotAfter();

  SslCtxPtr server = ServerContext(identity);
  SslCtxPtr client = ClientContext();
  Handshake h = Connect(server.get(), client.get());
  ASSERT_TRUE(h.done);
  EXPECT_EQ(ServedFingerprint(h), PemFingerprint(dir_ + "/cert.pem"));
  STACK_OF(X509)* chain = SSL_get_peer_cert_chain(h.client.get());
  ASSERT_NE(chain, nullptr);
  EXPECT_EQ(sk_X509_num(chain), 2);
}

TEST_F(TlsIdentityTest, OnlyTls12AndLaterAreSpoken) {
  TlsIdentity identity(dir_, nullptr);
  std::string error;
  ASSERT_TRUE(identity.Load(&error)) << error;
  SslCtxPtr server = ServerContext(identity);
  EXPECT_FALSE(Connect(server.get(), ClientContext(TLS1_1_VERSION).get()).done);
  Handshake h = Connect(server.get(), ClientContext(TLS1_2_VERSION).get());
  ASSERT_TRUE(h.done);
  EXPECT_EQ(SSL_version(h.client.get()), TLS1_2_VERSION);
}

TEST_F(TlsIdentityTest, ANewlyDeployedSetIsServedToNewConnectionsOnly) {
  TlsIdentity identity(dir_,
                       [this](const std::string& l) { log_.push_back(l); });
  std::string error;
  ASSERT_TRUE(identity.Load(&error)) << error;
  SslCtxPtr server = ServerContext(identity);
  SslCtxPtr client = ClientContext();
  Handshake before = Connect(server.get(), client.get());
  ASSERT_TRUE(before.done);
  const std::string first = PemFingerprint(root_.Path("/service/cert.pem"));
  EXPECT_FALSE(identity.Refresh(false));  // nothing changed

  Deploy(root_.Path("/second"));
  const std::string second = PemFingerprint(root_.Path("/second/cert.pem"));
  ASSERT_NE(first, second);
  // The next handshake notices the new files by itself.
  Handshake after = Connect(server.get(), client.get());
  ASSERT_TRUE(after.done);
  EXPECT_EQ(ServedFingerprint(after), second);
  EXPECT_EQ(identity.Fingerprint(), second);
  // The open connection keeps what it was given and still works.
  EXPECT_EQ(ServedFingerprint(before), first);
  ASSERT_EQ(SSL_write(before.client.get(), "ping", 4), 4);
  char buf[8];
  ASSERT_EQ(SSL_read(before.server.get(), buf, sizeof(buf)), 4);
  EXPECT_EQ(std::string(buf, 4), "ping");
  ASSERT_FALSE(log_.empty());
  EXPECT_NE(log_.back().find(second), std::string::npos) << log_.back();
}

TEST_F(TlsIdentityTest, ABrokenOrHalfDeployedSetNeverReplacesAWorkingOne) {
  TlsIdentity identity(dir_,
                       [this](const std::string& l) { log_.push_back(l); });
  std::string error;
  ASSERT_TRUE(identity.Load(&error)) << error;
  const std::string first = identity.Fingerprint();
  SslCtxPtr server = ServerContext(identity);
  SslCtxPtr client = ClientContext();

  // A new certificate beside the old key (half way through a copy).
  ASSERT_EQ(ZEPH::test::Run({"/bin/cp", root_.Path("/second/fullchain.pem"),
                             dir_ + "/fullchain.pem"})
                .status,
            0);
  EXPECT_FALSE(identity.Refresh(true));
  Handshake h = Connect(server.get(), client.get());
  ASSERT_TRUE(h.done);
  EXPECT_EQ(ServedFingerprint(h), first);
  ASSERT_FALSE(log_.empty());
  EXPECT_NE(log_.back().find("does not belong"), std::string::npos)
      << log_.back();

  // The directory gone for a moment.
  ASSERT_EQ(ZEPH::test::Run({"/bin/rm", "-rf", dir_}).status, 0);
  EXPECT_FALSE(identity.Refresh(true));
  EXPECT_TRUE(Connect(server.get(), client.get()).done);
  EXPECT_EQ(identity.Fingerprint(), first);

  // Garbage in the files.
  ASSERT_EQ(ZEPH::test::Run({"/bin/mkdir", "-p", dir_}).status, 0);
  ZEPH::test::WriteFile(dir_ + "/fullchain.pem", "not a certificate\n");
  ZEPH::test::WriteFile(dir_ + "/privkey.pem", "not a key\n");
  EXPECT_FALSE(identity.Refresh(false));
  EXPECT_EQ(identity.Fingerprint(), first);

  // A matching set whose key TLS refuses at its security level.
  const std::string weak = root_.Path("/weak");
  ASSERT_EQ(ZEPH::test::Run({"/bin/mkdir", "-p", weak}).status, 0);
  ASSERT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "req", "-x509", "-newkey",
                             "rsa:1024", "-nodes", "-keyout", weak + "/privkey.pem",
                             "-out", weak + "/fullchain.pem", "-days", "30",
                             "-subj", "/CN=weak.example"})
                .status,
            0);
  ZEPH::test::Run({"/bin/cp", weak + "/fullchain.pem", weak + "/cert.pem"});
  Deploy(weak);
  EXPECT_FALSE(identity.Refresh(true));
  EXPECT_EQ(identity.Fingerprint(), first);
  EXPECT_NE(log_.back().find("refused by TLS"), std::string::npos) << log_.back();
  EXPECT_TRUE(Connect(server.get(), client.get()).done);

  // Then a complete set: taken up.
  Deploy(root_.Path("/second"));
  Handshake later = Connect(server.get(), client.get());
  ASSERT_TRUE(later.done);
  EXPECT_EQ(ServedFingerprint(later),
            PemFingerprint(root_.Path("/second/cert.pem")));
}

TEST_F(TlsIdentityTest, LoadSaysWhyThereIsNoIdentity) {
  std::string error;
  TlsIdentity missing(root_.Path("/nowhere"), nullptr);
  EXPECT_FALSE(missing.Load(&error));
  EXPECT_NE(error.find(root_.Path("/nowhere")), std::string::npos) << error;
  EXPECT_TRUE(missing.Fingerprint().empty());

  ASSERT_EQ(ZEPH::test::Run({"/bin/cp", root_.Path("/second/privkey.pem"),
                             dir_ + "/privkey.pem"})
                .status,
            0);
  TlsIdentity mismatched(dir_, nullptr);
  EXPECT_FALSE(mismatched.Load(&error));
  EXPECT_NE(error.find("does not belong"), std::string::npos) << error;

  // A server context without an identity finishes no handshake.
  SslCtxPtr server = ServerContext(missing);
  EXPECT_FALSE(Connect(server.get(), ClientContext().get()).done);
}

}  // namespace
