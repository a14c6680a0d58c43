#include "tools/zeph_letsencrypt/commands.h"

#include <errno.h>
#include <glob.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <iostream>
#include <map>
#include <vector>

#include "module/common/paths.h"
#include "tools/zeph_letsencrypt/accounts.h"
#include "tools/zeph_letsencrypt/classify.h"
#include "tools/zeph_letsencrypt/config.h"
#include "tools/zeph_letsencrypt/eab_account.h"
#include "tools/zeph_letsencrypt/files.h"
#include "tools/zeph_letsencrypt/issued_set.h"
#include "tools/zeph_letsencrypt/lego_process.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_error.h"
#include "zeph/qlibc_lock.h"
#include "zeph/root.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

// RFC 5280 reason code: the certificate is revoked because it is taken out
// of use (the module revokes what it deletes).
constexpr char kRevokeReason[] = "5";

// The most names one certificate is ordered for (Let's Encrypt's limit).
constexpr size_t kMaxDomains = 100;

// What one certificate is ordered with.
struct Order {
  std::string domain;                // the first name, the common name
  std::vector<std::string> domains;  // every name, `domain` first
  std::string email;
  std::string directory_url;
  std::string key_type;
  std::string lego_path;  // appliance path of lego's data directory
};

std::string Lower(std::string s) {
  std::transform(s.begin(), s.end(), s.begin(),
                 [](unsigned char c) { return static_cast<char>(tolower(c)); });
  return s;
}

std::string UtcNow() {
  const time_t now = time(nullptr);
  struct tm when;
  gmtime_r(&now, &when);
  char text[32];
  strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &when);
  return text;
}

std::string Errno(const std::string& what) { return what + ": " + strerror(errno); }

// The e-mail becomes a directory name in lego's data directory and an
// account contact; the server judges the rest.
bool IsUsableEmail(const std::string& email) {
  const size_t at = email.find('@');
  return at != std::string::npos && at > 0 && at + 1 < email.size() &&
         email[0] != '.' && email.find_first_of("/ \t\r\n\\") == std::string::npos;
}

std::string ArchiveDir() { return RootPath(cert::kArchiveDir); }

// The tool's lock and a private working directory for one lego run; both
// go when the session does.
class Session {
 public:
  Session() = default;
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;
  ~Session() {
    if (!work_.empty()) RemoveTree(work_);
    if (lock_fd_ >= 0) QLIBCFileUnlockByFile(lock_fd_);
  }

  // Makes the state directories, takes the lock and makes the working
  // directory with its link to the accounts of lego's data directory.
  Outcome Open(const Config& config, const std::string& lego_path) {
    const std::string lego_dir = RootPath(lego_path);
    const std::string accounts = lego_dir + "/accounts";
    const std::string work_root = RootPath(kWorkDir);
    for (const std::string& dir : {RootPath(kStateDir), lego_dir, accounts, work_root}) {
      if (!MakeDir(dir, 0700)) return Outcome::Fail(kInternal, Errno("cannot make " + dir));
    }
    int fd = -1;
    if (!QLIBCFileLockTimeByFile(RootPath(kLockFile).c_str(), QLIBC_LOCK_EXCLUSIVE,
                                 config.timeout_s, &fd)) {
      if (QLIBCErrGet() == QLIBC_ERR_TIMEOUT) {
        return Outcome::Fail(kTimedOut, "another ACME run held the lock for " +
                                            std::to_string(config.timeout_s) + " s");
      }
      return Outcome::Fail(kInternal, "cannot take the lock " + RootPath(kLockFile));
    }
    lock_fd_ = fd;
    std::string work = work_root + "/XXXXXX";
    if (mkdtemp(&work[0]) == nullptr) {
      return Outcome::Fail(kInternal, Errno("cannot make a working directory in " + work_root));
    }
    work_ = work;
    if (symlink(accounts.c_str(), (work_ + "/accounts").c_str()) != 0) {
      return Outcome::Fail(kInternal, Errno("cannot link " + accounts));
    }
    return Outcome();
  }

  const std::string& work() const { return work_; }

 private:
  int lock_fd_ = -1;
  std::string work_;
};

// Removes a directory tree when it goes out of scope, unless released.
class ScopedTree {
 public:
  explicit ScopedTree(std::string path) : path_(std::move(path)) {}
  ~ScopedTree() {
    if (!path_.empty()) RemoveTree(path_);
  }
  ScopedTree(const ScopedTree&) = delete;
  ScopedTree& operator=(const ScopedTree&) = delete;

 private:
  std::string path_;
};

// Removes every path that matches the glob `pattern`.
void RemoveMatches(const std::string& pattern) {
  glob_t found{};
  if (glob(pattern.c_str(), 0, nullptr, &found) == 0) {
    for (size_t i = 0; i < found.gl_pathc; ++i) RemoveTree(found.gl_pathv[i]);
  }
  globfree(&found);
}

std::map<std::string, std::string> LegoEnvironment(const Config& config) {
  std::map<std::string, std::string> env = config.environment;
  if (!config.ca_bundle.empty()) env["LEGO_CA_CERTIFICATES"] = config.ca_bundle;
  return env;
}

// Error 102 when `domains` holds a wildcard name and the challenge is not
// DNS-01, the only one that can validate it.
Outcome NeedsDnsFor(const Config& config, const std::vector<std::string>& domains) {
  for (const std::string& domain : domains) {
    if (domain.compare(0, 2, "*.") == 0 && config.dns_provider.empty()) {
      return Outcome::Fail(kInvalidDomain,
                           "the wildcard name " + domain +
                               " can only be validated with DNS-01: choose a DNS "
                               "provider in the Let's Encrypt settings");
    }
  }
  return Outcome();
}

LegoRun RunInSession(const Config& config, const Session& session,
                     const std::vector<std::string>& args) {
  LegoRun run = RunLego(kLegoProgram, args, LegoEnvironment(config),
                        session.work() + "/lego.log", config.timeout_s);
  if (!run.output.empty()) std::cerr << run.output << std::flush;
  return run;
}

// Runs lego's "run" for `order` in the open `session` and reads what it
// obtained.
Outcome Obtain(const Config& config, const Order& order, const Session& session,
               IssuedSet* set) {
  std::vector<std::string> args = {
      "--server", order.directory_url, "--accept-tos",
      "--email", order.email, "--path", session.work(),
      "--key-type", order.key_type};
  for (const std::string& domain : order.domains) {
    args.insert(args.end(), {"--domains", domain});
  }
  // The binding's account is registered by the tool, lego is told only
  // that the server wants one: the HMAC key stays off its command line.
  if (!config.eab_kid.empty() && order.directory_url == config.directory_url) {
    const Outcome o = EnsureEabAccount(config, order.directory_url, order.email,
                                       RootPath(order.lego_path));
    if (!o.ok()) return o;
    args.push_back("--eab");
  }
  if (!config.dns_provider.empty()) {
    args.insert(args.end(), {"--dns", config.dns_provider});
    for (const std::string& resolver : config.dns_resolvers) {
      args.insert(args.end(), {"--dns.resolvers", resolver});
    }
    if (config.dns_disable_cp) args.push_back("--dns.disable-cp");
  } else if (!config.http_webroot.empty()) {
    args.insert(args.end(), {"--http", "--http.webroot", config.http_webroot});
  } else {
    args.insert(args.end(), {"--http", "--http.port", config.http_address});
  }
  args.insert(args.end(), {"run", "--no-bundle"});
  const Outcome o = ClassifyLegoRun(RunInSession(config, session, args),
                                    Operation::kObtain, config.timeout_s);
  if (!o.ok()) return o;
  return ReadLegoCertificate(session.work() + "/certificates", set);
}

Json::Value RenewJson(const Order& order, const IssuedSet& set) {
  Json::Value renew(Json::objectValue);
  renew["domain"] = order.domain;
  if (order.domains.size() > 1) {
    for (const std::string& d : order.domains) renew["domains"].append(d);
  }
  renew["email"] = order.email;
  renew["account"] = AccountName(order.directory_url, order.email);
  renew["directory_url"] = order.directory_url;
  renew["lego_path"] = order.lego_path;
  renew["key_type"] = order.key_type;
  renew["serial"] = set.serial;
  renew["not_after"] = set.not_after;
  renew["issued_at"] = UtcNow();
  return renew;
}

Outcome Issued(const Order& order, const IssuedSet& set) {
  std::string error;
  if (!RecordAccount(RootPath(kAccountDir), order.directory_url, order.email, &error)) {
    // The certificate is there and usable; only the list of accounts
    // misses an entry.
    std::cerr << "zeph-letsencrypt: " << error << std::endl;
  }
  Outcome o;
  o.data["domain"] = order.domain;
  if (order.domains.size() > 1) {
    for (const std::string& d : order.domains) o.data["domains"].append(d);
  }
  o.data["account"] = AccountName(order.directory_url, order.email);
  o.data["serial"] = set.serial;
  o.data["not_after"] = set.not_after;
  return o;
}

// The order recorded in the renew.json of archive directory `id`.
Outcome ReadOrder(const std::string& id, Order* order) {
  if (!IsDirectoryName(id)) {
    return Outcome::Fail(kBadCommandLine, "invalid certificate id '" + id + "'");
  }
  const std::string dir = ArchiveDir() + "/" + id;
  struct stat st;
  if (stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    return Outcome::Fail(kNotRenewable, "no certificate directory " + dir);
  }
  const std::string path = dir + "/" + kRenewFile;
  Json::Value renew;
  if (access(path.c_str(), F_OK) != 0) {
    return Outcome::Fail(kNotRenewable,
                         id + " is not a certificate of this tool: no " + path);
  }
  if (!JsonFromFile(renew, path) || !renew.isObject()) {
    return Outcome::Fail(kNotRenewable, path + " is not a JSON object");
  }
  for (const char* member : {"domain", "email", "directory_url"}) {
    if (!renew[member].isString() || renew[member].asString().empty()) {
      return Outcome::Fail(kNotRenewable,
                           path + " has no \"" + member + "\"");
    }
  }
  order->domain = renew["domain"].asString();
  order->domains = {order->domain};
  // Several names: all of them, the first being "domain".
  const Json::Value& domains = renew["domains"];
  if (domains.isArray() && !domains.empty()) {
    order->domains.clear();
    for (const Json::Value& d : domains) {
      if (!d.isString() || !IsDomainName(d.asString())) {
        return Outcome::Fail(kNotRenewable, path + " does not describe a certificate");
      }
      order->domains.push_back(d.asString());
    }
    if (order->domains[0] != order->domain) {
      return Outcome::Fail(kNotRenewable, path + " does not describe a certificate");
    }
  }
  order->email = renew["email"].asString();
  order->directory_url = renew["directory_url"].asString();
  order->key_type = renew["key_type"].isString() ? renew["key_type"].asString() : "";
  order->lego_path =
      renew["lego_path"].isString() ? renew["lego_path"].asString() : kLegoDir;
  if (!IsDomainName(order->domain) || !IsUsableEmail(order->email) ||
      order->lego_path.empty() || order->lego_path[0] != '/') {
    return Outcome::Fail(kNotRenewable, path + " does not describe a certificate");
  }
  return Outcome();
}

}  // namespace

bool IsDirectoryName(const std::string& name) {
  return !name.empty() && name != "." && name != ".." &&
         name.find('/') == std::string::npos;
}

bool ParseDomains(const std::string& text, std::vector<std::string>* domains,
                  std::string* why) {
  domains->clear();
  size_t start = 0;
  for (;;) {
    const size_t comma = text.find(',', start);
    std::string name =
        text.substr(start, comma == std::string::npos ? std::string::npos : comma - start);
    // Blanks after a "," are natural in a list; a single name is taken as
    // it stands.
    const bool list = text.find(',') != std::string::npos;
    const size_t first = list ? name.find_first_not_of(' ') : 0;
    const size_t last = list ? name.find_last_not_of(' ') : name.size() - 1;
    name = first == std::string::npos || name.empty()
               ? ""
               : Lower(name.substr(first, last - first + 1));
    if (!IsDomainName(name)) {
      *why = "invalid domain name '" + name + "'";
      return false;
    }
    if (std::find(domains->begin(), domains->end(), name) == domains->end()) {
      domains->push_back(name);
    }
    if (comma == std::string::npos) break;
    start = comma + 1;
  }
  if (domains->size() > kMaxDomains) {
    *why = "more than " + std::to_string(kMaxDomains) + " names for one certificate";
    return false;
  }
  return true;
}

bool IsDomainName(const std::string& domain) {
  std::string rest = domain;
  if (rest.compare(0, 2, "*.") == 0) rest = rest.substr(2);
  if (rest.empty() || domain.size() > 253) return false;
  size_t start = 0;
  for (;;) {
    const size_t dot = rest.find('.', start);
    const std::string label =
        rest.substr(start, dot == std::string::npos ? std::string::npos : dot - start);
    if (label.empty() || label.size() > 63 || label.front() == '-' ||
        label.back() == '-') {
      return false;
    }
    for (char c : label) {
      if (!isalnum(static_cast<unsigned char>(c)) && c != '-') return false;
    }
    if (dot == std::string::npos) return true;
    start = dot + 1;
  }
}

Outcome NewCert(const std::string& domain_arg, const std::string& email_arg,
                const std::string& name) {
  if (!IsDirectoryName(name)) {
    return Outcome::Fail(kBadCommandLine, "invalid directory name '" + name + "'");
  }
  std::vector<std::string> domains;
  std::string why;
  if (!ParseDomains(domain_arg, &domains, &why)) {
    return Outcome::Fail(kInvalidDomain,
                         domain_arg.find(',') == std::string::npos
                             ? "invalid domain name '" + domain_arg + "'"
                             : why);
  }
  Config config;
  Outcome o = LoadConfig(RootPath(kConfigFile), &config);
  if (!o.ok()) return o;
  o = NeedsDnsFor(config, domains);
  if (!o.ok()) return o;

  Order order;
  order.domain = domains[0];
  order.domains = domains;
  order.directory_url = config.directory_url;
  order.key_type = config.key_type;
  order.lego_path = kLegoDir;
  order.email = email_arg.empty()
                    ? OnlyAccountFor(RootPath(kAccountDir), config.directory_url)
                    : email_arg;
  if (order.email.empty()) {
    return Outcome::Fail(kAccountRefused,
                         "no e-mail address given and no single account recorded for " +
                             config.directory_url);
  }
  if (!IsUsableEmail(order.email)) {
    return Outcome::Fail(kAccountRefused, "invalid e-mail address '" + order.email + "'");
  }
  const std::string target = ArchiveDir() + "/" + name;
  if (!MakeDir(target, 0700)) {
    return Outcome::Fail(kWriteFailed, Errno("cannot make " + target));
  }

  Session session;
  o = session.Open(config, order.lego_path);
  if (!o.ok()) return o;
  IssuedSet set;
  o = Obtain(config, order, session, &set);
  if (!o.ok()) return o;
  o = WriteSet(target, set, RenewJson(order, set));
  if (!o.ok()) return o;
  return Issued(order, set);
}

Outcome Renew(const std::string& id) {
  Order order;
  Outcome o = ReadOrder(id, &order);
  if (!o.ok()) return o;
  Config config;
  o = LoadConfig(RootPath(kConfigFile), &config);
  if (!o.ok()) return o;
  o = NeedsDnsFor(config, order.domains);
  if (!o.ok()) return o;
  if (order.key_type.empty()) order.key_type = config.key_type;

  // The lock is held to the end, so that no other run works on the
  // staging directories meanwhile.
  Session session;
  o = session.Open(config, order.lego_path);
  if (!o.ok()) return o;
  const std::string stale = ArchiveDir() + "/." + id + ".renew.*";
  RemoveMatches(stale);  // left by a run that was killed
  IssuedSet set;
  o = Obtain(config, order, session, &set);
  if (!o.ok()) return o;

  // The new set is made whole beside the old one, then the two directories
  // change places in one rename; the old set leaves with the staging name.
  const std::string dir = ArchiveDir() + "/" + id;
  std::string staging = ArchiveDir() + "/." + id + ".renew.XXXXXX";
  if (mkdtemp(&staging[0]) == nullptr) {
    return Outcome::Fail(kWriteFailed, Errno("cannot make a staging directory for " + dir));
  }
  ScopedTree staging_guard(staging);
  o = WriteSet(staging, set, RenewJson(order, set));
  if (!o.ok()) return o;
  struct stat st;
  if (stat(dir.c_str(), &st) == 0) chmod(staging.c_str(), st.st_mode & 07777);
  if (!ExchangeDirs(staging, dir)) {
    return Outcome::Fail(kWriteFailed, Errno("cannot replace " + dir));
  }
  return Issued(order, set);
}

Outcome Revoke(const std::string& id) {
  Order order;
  Outcome o = ReadOrder(id, &order);
  if (!o.ok()) return o;
  const std::string dir = ArchiveDir() + "/" + id;
  std::string cert;
  if (!ReadWhole(dir + "/cert.pem", &cert)) {
    return Outcome::Fail(kNotRenewable, Errno("cannot read " + dir + "/cert.pem"));
  }
  Config config;
  o = LoadConfig(RootPath(kConfigFile), &config);
  if (!o.ok()) return o;

  Session session;
  o = session.Open(config, order.lego_path);
  if (!o.ok()) return o;
  // lego revokes "<path>/certificates/<domain>.crt", a wildcard's "*" made "_".
  std::string file_name = order.domain;
  std::replace(file_name.begin(), file_name.end(), '*', '_');
  const std::string certificates = session.work() + "/certificates";
  if (!MakeDir(certificates, 0700) ||
      !WriteWhole(certificates + "/" + file_name + ".crt", cert, 0600)) {
    return Outcome::Fail(kInternal, Errno("cannot prepare " + certificates));
  }
  std::vector<std::string> args = {
      "--server", order.directory_url, "--email", order.email,
      "--path", session.work(), "--domains", order.domain};
  // At a CA that demands the binding lego refuses to act for an account
  // unless told that the server wants one (the account exists already).
  if (!config.eab_kid.empty() && order.directory_url == config.directory_url) {
    args.push_back("--eab");
  }
  args.insert(args.end(), {"revoke", "--keep", "--reason", kRevokeReason});
  o = ClassifyLegoRun(RunInSession(config, session, args), Operation::kRevoke,
                      config.timeout_s);
  if (!o.ok()) return o;
  o.data["domain"] = order.domain;
  return o;
}

}  // namespace letsencrypt
}  // namespace ZEPH
