// What lego says about its DNS providers, for the settings' checks and
// the page's choice of a provider and its credential variables.
//
// Runs "/usr/bin/lego dnshelp" (no shell, nothing inherited, its standard
// error discarded) and reads its text.
//
// Thread-safety: no state; each call runs its own lego.
#ifndef ZEPH_ACME_DNS_PROVIDERS_H_
#define ZEPH_ACME_DNS_PROVIDERS_H_

#include <json/json.h>

#include <string>
#include <vector>

namespace ZEPH {
namespace acme {

// The ACME client, the machine's own.
constexpr char kLegoProgram[] = "/usr/bin/lego";

// A provider code as lego names them ("cloudflare", "acme-dns", "exec"):
// letters, digits, ".", "-", "_", a letter or digit first.
bool IsProviderCode(const std::string& code);

// The DNS providers lego knows, from "lego dnshelp". False when lego
// cannot be run.
bool DnsProviders(std::vector<std::string>* codes);

// lego's description of DNS provider `code` ("lego dnshelp -c CODE"):
//   {"code", "name", "credentials": [{"name", "description"}],
//    "additional": [{"name", "description"}]}
// False when lego does not know the provider or cannot be run.
bool DnsProviderHelp(const std::string& code, Json::Value* help);

}  // namespace acme
}  // namespace ZEPH

#endif  // ZEPH_ACME_DNS_PROVIDERS_H_
