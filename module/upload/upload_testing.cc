#include "module/upload/upload_testing.h"

#include <gtest/gtest.h>

#include <sstream>
#include <vector>

#include "module/frame/table.h"
#include "test_support.h"

namespace ZEPH {
namespace test {
namespace {

const char kOpenssl[] = "/usr/bin/openssl";

void Openssl(const std::vector<std::string>& args) {
  std::vector<std::string> argv = {kOpenssl};
  argv.insert(argv.end(), args.begin(), args.end());
  const CommandResult r = Run(argv);
  EXPECT_EQ(r.status, 0) << args[0] << ": " << r.err;
}

class CopySink : public DownloadSink {
 public:
  explicit CopySink(ExportResult& result) : result_(result) {}
  bool Deliver(const HeaderList& headers, const std::string& path) override {
    result_.delivered = true;
    result_.headers = headers;
    result_.copy = ReadFile(path);
    return true;
  }

 private:
  ExportResult& result_;
};

}  // namespace

void MakeKey(KeyKind kind, const std::string& path) {
  switch (kind) {
    case KeyKind::kRsa:
      Openssl({"genpkey", "-algorithm", "RSA", "-pkeyopt",
               "rsa_keygen_bits:2048", "-out", path});
      break;
    case KeyKind::kEc:
      Openssl({"genpkey", "-algorithm", "EC", "-pkeyopt",
               "ec_paramgen_curve:P-256", "-out", path});
      break;
    case KeyKind::kEd25519:
      Openssl({"genpkey", "-algorithm", "ED25519", "-out", path});
      break;
    case KeyKind::kDsa:
      Openssl({"genpkey", "-genparam", "-algorithm", "DSA", "-pkeyopt",
               "dsa_paramgen_bits:1024", "-out", path + ".param"});
      Openssl({"genpkey", "-paramfile", path + ".param", "-out", path});
      break;
  }
}

void MakeSelfSigned(const std::string& key, const std::string& cn,
                    const std::string& out) {
  Openssl({"req", "-x509", "-new", "-key", key, "-subj", "/CN=" + cn, "-days",
           "30", "-out", out});
}

void MakeIssued(const std::string& key, const std::string& cn,
                const std::string& ca_cert, const std::string& ca_key,
                const std::string& out) {
  Openssl({"req", "-new", "-key", key, "-subj", "/CN=" + cn, "-out",
           out + ".csr"});
  Openssl({"x509", "-req", "-in", out + ".csr", "-CA", ca_cert, "-CAkey",
           ca_key, "-set_serial", "7", "-days", "30", "-out", out});
}

ExportResult CallExport(const Json::Value& params) {
  ExportResult result;
  for (const ZEPH_API_TABLE* row = GetAPITable(); row->api != nullptr; ++row) {
    if (std::string(row->api) == "ZEPH.Core.Certificate" &&
        std::string(row->method) == "export") {
      APIRequest request(params);
      CopySink sink(result);
      ScopedDownloadSink scope(&sink);
      row->handler(&request, &result.response);
      return result;
    }
  }
  ADD_FAILURE() << "no export row";
  return result;
}

void SaveDownload(const ExportResult& r, const std::string& path) {
  WriteFile(path, r.copy, 0600);
}

}  // namespace test
}  // namespace ZEPH
