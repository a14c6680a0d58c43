// Fixtures of the archive and deployment tests: certificate sets made with the system's
// openssl, catalogues below the test's root, service objects, an unprivileged child.
#ifndef ZEPH_MODULE_ARCHIVE_ARCHIVE_TESTING_H_
#define ZEPH_MODULE_ARCHIVE_ARCHIVE_TESTING_H_

#include <json/json.h>
#include <sys/types.h>

#include <functional>
#include <initializer_list>
#include <string>

namespace ZEPH {
namespace test {

std::string CurrentUserName();

// Writes "privkey.pem" (EC P-256), a self-signed "cert.pem" for `cn` valid for a year and
// "fullchain.pem" into `dir`; a `full` set also has an issuer certificate as "chain.pem"
// (appended to the full chain) and "zeph-ca-cert.pem". Records a failure when openssl fails.
bool MakeCertSet(const std::string& dir, const std::string& cn, bool full = false);
// The archive directory of `id` with a certificate set; returns its path.
std::string MakeArchiveCert(const std::string& id, bool full = false);
// SHA-256 of the first certificate's DER form, by the openssl command line.
std::string OpensslFingerprint(const std::string& pem_path);

Json::Value ServiceObject(const std::string& subscriber, const std::string& service,
                          bool package = false, const std::string& owner = CurrentUserName());
Json::Value JsonArray(std::initializer_list<Json::Value> items);
Json::Value InfoEntry(const Json::Value& services = Json::Value(Json::arrayValue));
// INFO of the current root: its path, written from a value or a text ("" removes it),
// read (null when it does not parse).
std::string InfoPath();
void WriteInfo(const Json::Value& info);
void WriteInfoText(const std::string& text);
Json::Value ReadInfo();

// Runs `body` in a child process and returns its exit status (-1 when it died). Under root the
// child first becomes "nobody": permission failures only show without root's privileges.
int RunUnprivileged(const std::function<int()>& body);
uid_t UnprivilegedUid();
gid_t UnprivilegedGid();

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_MODULE_ARCHIVE_ARCHIVE_TESTING_H_
