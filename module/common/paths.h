// Fixed appliance paths of the certificate module, as they stand on the
// appliance. Pass each through ZEPH::RootPath before touching the disk, so
// that the module works below a private root (ZEPH_ROOT); log lines show the
// prefixed path.
#ifndef ZEPH_MODULE_COMMON_PATHS_H_
#define ZEPH_MODULE_COMMON_PATHS_H_

namespace ZEPH {
namespace cert {

// The certificate archive and its catalogue files.
constexpr char kArchiveDir[] = "/usr/zeph/etc/certificate/_archive";
constexpr char kInfoFile[] = "/usr/zeph/etc/certificate/_archive/INFO";
constexpr char kInfoTempFile[] = "/usr/zeph/etc/certificate/_archive/INFO.temp";
constexpr char kInfoBrokenFile[] = "/usr/zeph/etc/certificate/_archive/INFO.broken";
constexpr char kDefaultFile[] = "/usr/zeph/etc/certificate/_archive/DEFAULT";
constexpr char kServicesFile[] = "/usr/zeph/etc/certificate/_archive/SERVICES";
constexpr char kInfoLockFile[] = "/tmp/zephcertificate_info.lock";

// Certificate roots for path confinement.
constexpr char kSystemCertRoot[] = "/usr/zeph/etc/certificate/";
constexpr char kLocalCertRoot[] = "/usr/local/etc/certificate/";

// Key-generation work files.
constexpr char kSslCfgDir[] = "/usr/zeph/etc/ssl/cfg.d";
constexpr char kCaCfg[] = "/usr/zeph/etc/ssl/cfg.d/ca.cfg";
constexpr char kServerCfg[] = "/usr/zeph/etc/ssl/cfg.d/server.cfg";
constexpr char kCaCrtCfg[] = "/usr/zeph/etc/ssl/cfg.d/ca.crt.cfg";
constexpr char kServerCrtCfg[] = "/usr/zeph/etc/ssl/cfg.d/server.crt.cfg";
constexpr char kGenDir[] = "/usr/zeph/etc/ssl/.gen";
constexpr char kServerCsr[] = "/usr/zeph/etc/ssl/.gen/server.csr";
constexpr char kCaCsr[] = "/usr/zeph/etc/ssl/ssl.csr/ca.csr";
constexpr char kSerialFile[] = "/usr/zeph/etc/ssl/.mkcert.serial";
constexpr char kMacAddressFile[] = "/proc/sys/kernel/zeph_mac_address1";

// Tools. The system programs are the machine's own and never prefixed.
constexpr char kOpenssl[] = "/usr/bin/openssl";
constexpr char k7z[] = "/usr/bin/7z";
constexpr char kCp[] = "/bin/cp";
constexpr char kRm[] = "/bin/rm";
constexpr char kMkdir[] = "/bin/mkdir";
constexpr char kMkcertTool[] = "/usr/zeph/bin/mkcert";
constexpr char kLetsEncryptTool[] = "/usr/zeph/sbin/zeph-letsencrypt";

}  // namespace cert
}  // namespace ZEPH

#endif  // ZEPH_MODULE_COMMON_PATHS_H_
