#include "host/provision.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <pwd.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

#include "zeph/json_file.h"
#include "zeph/root.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace {

struct DirSpec {
  const char* path;
  mode_t mode;
  bool private_root_only;
};

const DirSpec kDirs[] = {
    {"/usr/zeph/etc/certificate/_archive", 0755, false},
    {"/usr/zeph/etc/ssl/cfg.d", 0755, false},
    {"/usr/zeph/etc/ssl/.gen", 0700, false},
    {"/usr/zeph/etc/ssl/ssl.csr", 0700, false},
    {"/usr/zeph/etc/letsencrypt/account", 0700, false},
    {"/usr/zeph/etc/webapid", 0700, false},
    {"/usr/zeph/bin", 0755, false},
    {"/usr/zeph/sbin", 0755, false},
    {"/usr/zeph/share/certificate.d", 0755, false},
    {"/usr/libexec/certificate.d", 0755, false},
    {"/usr/local/etc/certificate", 0755, false},
    {"/usr/local/share/certificate.d", 0755, false},
    {"/usr/local/libexec/certificate.d", 0755, false},
    {"/var/log/zeph", 0755, false},
    {"/tmp", 01777, true},
    {"/proc/sys/kernel", 0755, true},
};

std::string CurrentUserName() {
  std::vector<char> buf(16384);
  struct passwd pw;
  struct passwd* result = nullptr;
  if (getpwuid_r(geteuid(), &pw, buf.data(), buf.size(), &result) == 0 &&
      result != nullptr) {
    return pw.pw_name;
  }
  return "root";
}

// Writes `content` to `path` only when the file does not exist yet.
bool WriteNew(const std::string& path, const std::string& content,
              mode_t mode, std::string* error) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode));
  if (!fd) {
    if (errno == EEXIST) return true;
    *error = "cannot create " + path + ": " + strerror(errno);
    return false;
  }
  if (write(fd.get(), content.data(), content.size()) !=
      static_cast<ssize_t>(content.size())) {
    *error = "cannot write " + path + ": " + strerror(errno);
    return false;
  }
  return true;
}

}  // namespace

std::string WebServiceJson(const std::string& owner) {
  Json::Value service(Json::objectValue);
  service["display_name"] = "Web administration";
  service["display_name_i18n"] = "certificate:service_web_admin";
  service["subscriber"] = "system";
  service["service"] = "default";
  service["isPkg"] = false;
  service["owner"] = owner;
  return JsonCompact(service);
}

std::string FirstHardwareAddress() {
  std::vector<std::pair<int, std::string>> found;  // (ifindex, address)
  DIR* dir = opendir("/sys/class/net");
  if (dir != nullptr) {
    while (struct dirent* e = readdir(dir)) {
      std::string name = e->d_name;
      if (name == "." || name == ".." || name == "lo") continue;
      std::ifstream addr_in("/sys/class/net/" + name + "/address");
      std::ifstream index_in("/sys/class/net/" + name + "/ifindex");
      std::string addr;
      int index = 0;
      if (!(addr_in >> addr) || !(index_in >> index)) continue;
      addr.erase(std::remove(addr.begin(), addr.end(), ':'), addr.end());
      if (addr.size() != 12 || addr == "000000000000") continue;
      found.emplace_back(index, addr);
    }
    closedir(dir);
  }
  if (found.empty()) return "000000000000";
  std::sort(found.begin(), found.end());
  std::string addr = found.front().second;
  std::transform(addr.begin(), addr.end(), addr.begin(), ::tolower);
  return addr;
}

bool ProvisionRoot(std::string* error) {
  const bool private_root = !RootDir().empty();
  for (const DirSpec& d : kDirs) {
    if (d.private_root_only && !private_root) continue;
    const std::string path = RootPath(d.path);
    if (ZEPHFSMkdirP(path.c_str(), nullptr, 1, 0, 0, d.mode) != 0) {
      *error = "cannot create directory " + path + ": " + strerror(errno);
      return false;
    }
  }
  const std::string services =
      "[" + WebServiceJson(CurrentUserName()) + "]\n";
  if (!WriteNew(RootPath("/usr/zeph/etc/certificate/_archive/SERVICES"),
                services, 0644, error) ||
      !WriteNew(RootPath("/usr/zeph/etc/features.conf"),
                "support_self_sign_cert=yes\n", 0644, error)) {
    return false;
  }
  // On a real appliance the kernel provides the address file.
  if (private_root &&
      !WriteNew(RootPath("/proc/sys/kernel/zeph_mac_address1"),
                FirstHardwareAddress() + "\n", 0444, error)) {
    return false;
  }
  return true;
}

}  // namespace ZEPH
