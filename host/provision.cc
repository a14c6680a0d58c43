#include "host/provision.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <pwd.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

#include "host/module_loader.h"
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

// Whole content of `path`; false when it cannot be read.
bool ReadAll(const std::string& path, std::string* content) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return false;
  content->clear();
  char buf[65536];
  ssize_t n;
  while ((n = read(fd.get(), buf, sizeof(buf))) != 0) {
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    content->append(buf, static_cast<size_t>(n));
  }
  return true;
}

// Writes `content` to a new file beside `path` and renames it onto `path`,
// so that nobody ever runs a half-written tool.
bool ReplaceWhole(const std::string& path, const std::string& content,
                  mode_t mode, std::string* error) {
  std::string temp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(&temp[0], O_CLOEXEC));
  if (!fd) {
    *error = "cannot create " + temp + ": " + strerror(errno);
    return false;
  }
  const bool written =
      write(fd.get(), content.data(), content.size()) ==
          static_cast<ssize_t>(content.size()) &&
      fchmod(fd.get(), mode) == 0 && fsync(fd.get()) == 0;
  const int saved = errno;
  fd.reset();
  if (!written || rename(temp.c_str(), path.c_str()) != 0) {
    *error = "cannot write " + path + ": " + strerror(written ? errno : saved);
    unlink(temp.c_str());
    return false;
  }
  return true;
}

// 64-bit FNV-1a of `bytes` in hexadecimal: enough to recognise our own
// earlier copy of a tool, which is all it is used for.
std::string Fingerprint(const std::string& bytes) {
  uint64_t h = 14695981039346656037ULL;
  for (unsigned char c : bytes) {
    h ^= c;
    h *= 1099511628211ULL;
  }
  char text[17];
  snprintf(text, sizeof(text), "%016llx", static_cast<unsigned long long>(h));
  return text;
}

std::string MarkerOf(const std::string& target) {
  const size_t slash = target.rfind('/');
  const std::string dir =
      slash == std::string::npos ? "." : target.substr(0, slash);
  const std::string base =
      slash == std::string::npos ? target : target.substr(slash + 1);
  return dir + "/." + base + ".provisioned";
}

}  // namespace

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

bool InstallTool(const std::string& source, const std::string& target,
                 std::string* error) {
  struct stat src_st, dst_st;
  if (source.empty() || stat(source.c_str(), &src_st) != 0) return true;
  const bool present = stat(target.c_str(), &dst_st) == 0;
  if (present && src_st.st_dev == dst_st.st_dev &&
      src_st.st_ino == dst_st.st_ino) {
    return true;  // an installed tree whose bin is the root's own
  }
  std::string tool;
  if (!ReadAll(source, &tool)) {
    *error = "cannot read " + source + ": " + strerror(errno);
    return false;
  }
  const std::string marker = MarkerOf(target);
  if (present) {
    std::string current, recorded;
    if (!ReadAll(target, &current)) return true;  // not ours to judge
    const bool recorded_ours = ReadAll(marker, &recorded) &&
                               recorded == Fingerprint(current) + "\n";
    if (current == tool) {
      // Up to date; adopt it so that a later rebuild can refresh it.
      return recorded_ours ||
             ReplaceWhole(marker, Fingerprint(tool) + "\n", 0644, error);
    }
    if (!recorded_ours) return true;  // somebody else's file
  }
  return ReplaceWhole(target, tool, 0755, error) &&
         ReplaceWhole(marker, Fingerprint(tool) + "\n", 0644, error);
}

std::string FindBuiltTool(const std::string& name) {
  const std::string dir = ExecutableDir();
  for (const std::string& candidate :
       {dir + "/" + name, dir + "/../bin/" + name, dir + "/../sbin/" + name}) {
    if (access(candidate.c_str(), X_OK) == 0) return candidate;
  }
  return "";
}

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
  if (!InstallTool(FindBuiltTool("mkcert"), RootPath("/usr/zeph/bin/mkcert"),
                   error) ||
      !InstallTool(FindBuiltTool("zeph-letsencrypt"),
                   RootPath("/usr/zeph/sbin/zeph-letsencrypt"), error)) {
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
