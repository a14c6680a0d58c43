// The action log as the administration page shows it.
//
// The appliance's event log (<root>/var/log/zeph/events.jsonl) holds one
// JSON object a line, appended by ZEPHLogSet1: "time", "type", "level",
// "message_id" and "text1" .. "text4". The certificate module records its
// actions there with the message ids 0x12B00001 to 0x12B00012; the texts
// carry the certificate's display name (text1) and, for a service binding,
// the service's display name (text2). The daily renewal run of the Let's
// Encrypt tool warns (level 2) with 0x12B00013 about a certificate in use
// that runs out and will not renew itself: text1 its name, text2 its
// services, text3 the day it expires, text4 the whole days left (negative
// once expired). The sentences that say what an id means are the
// server's: the writers only write ids.
//
// Thread-safety: free functions; ReadEvents takes a shared lock on the file,
// as the writers take an exclusive one, so it never sees half a line.
#ifndef ZEPH_SERVER_EVENT_LOG_H_
#define ZEPH_SERVER_EVENT_LOG_H_

#include <json/json.h>

#include <string>

namespace ZEPH {
namespace webapid {

constexpr char kEventsFile[] = "/var/log/zeph/events.jsonl";

// The English sentence for an event: what happened, naming the certificate
// (`text1`) and the service (`text2`) when the texts are not empty, and for
// an expiry warning the day and days left (`text3`, `text4`). Unknown ids
// get a neutral sentence naming the id.
std::string EventSentence(unsigned int message_id, const std::string& text1,
                          const std::string& text2, const std::string& text3 = "",
                          const std::string& text4 = "");

// The newest `limit` events of the file at `path`, newest first, as an
// array of the stored objects, each with "message" (its sentence) and
// "severity" ("info" for level 1, "warning" for level 2, "error" for
// level 3, else "notice")
// added. Lines that are not JSON objects are skipped; only the last 4 MiB
// of a longer file are looked at. A missing file is an empty log. False
// only when the file exists and cannot be read.
bool ReadEvents(const std::string& path, size_t limit, Json::Value* events);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_EVENT_LOG_H_
