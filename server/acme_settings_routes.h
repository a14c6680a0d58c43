// The Let's Encrypt settings offered to the administration page.
//
//   GET  /server/letsencrypt/settings
//        200 {"success": true, "data": <settings>}: the settings as
//        acme::PublicView gives them (secrets only as "is set").
//   POST /server/letsencrypt/settings
//        body: a JSON object of changes (acme::UpdateSettings), at most
//        1 MiB. 200 with the new settings as above, or 400
//        {"success": false, "error": {"code": 400, "data": {"message",
//        "setting"}}} with nothing saved; 415 for a body that is not JSON.
//   GET  /server/letsencrypt/dns-providers
//        200 {"providers": ["acme-dns", ...]}, the DNS providers of lego;
//        503 when lego cannot be run.
//   GET  /server/letsencrypt/dns-providers/<code>
//        200 {"code", "name", "credentials": [{"name", "description"}],
//        "additional": [...]}; 404 for a provider lego does not know.
//
// Every route wants the access token (`authorized`); without it the answer
// is 401 and nothing is read or changed. Bodies and answers are never
// logged (the settings hold secrets).
//
// Thread-safety: the handlers keep no state; changes of the settings are
// serialised by acme::UpdateSettings.
#ifndef ZEPH_SERVER_ACME_SETTINGS_ROUTES_H_
#define ZEPH_SERVER_ACME_SETTINGS_ROUTES_H_

#include <functional>
#include <string>

namespace httplib {
class Server;
struct Request;
}  // namespace httplib

namespace ZEPH {
namespace webapid {

// Adds the routes above to `http` for the tool's state directory
// `state_dir`. Call it before routes that would match the same paths.
void InstallAcmeSettingsRoutes(
    httplib::Server& http, const std::string& state_dir,
    std::function<bool(const httplib::Request&)> authorized);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_ACME_SETTINGS_ROUTES_H_
