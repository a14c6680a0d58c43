#include "server/event_log.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <vector>

#include "zeph/json_file.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {
namespace {

constexpr off_t kTailBytes = 4 << 20;

std::string Quoted(const std::string& text) { return "\"" + text + "\""; }

// The sentence for a certificate action: `named` with the certificate's
// name put in for "%s", or `unnamed` when the event carries no name.
std::string CertSentence(const std::string& name, const char* named,
                         const char* unnamed) {
  if (name.empty()) return unnamed;
  std::string out = named;
  const size_t at = out.find("%s");
  return out.replace(at, 2, Quoted(name));
}

}  // namespace

std::string EventSentence(unsigned int message_id, const std::string& text1,
                          const std::string& text2, const std::string& text3,
                          const std::string& text4) {
  switch (message_id) {
    case 0x12B00001:
      return CertSentence(text1,
                          "Certificate %s was made the default certificate.",
                          "A certificate was made the default certificate.");
    case 0x12B00002:
      return CertSentence(
          text1, "Certificate %s could not be made the default certificate.",
          "A certificate could not be made the default certificate.");
    case 0x12B00003:
      return CertSentence(text1, "Certificate %s was created.",
                          "A certificate was created.");
    case 0x12B00004:
      return CertSentence(text1, "Certificate %s was replaced.",
                          "A certificate was replaced.");
    case 0x12B00005:
      return CertSentence(text1, "Certificate %s was deleted.",
                          "A certificate was deleted.");
    case 0x12B00006:
      return CertSentence(text1, "Certificate %s could not be deleted.",
                          "A certificate could not be deleted.");
    case 0x12B00007:
    case 0x12B00008: {
      const bool ok = message_id == 0x12B00007;
      std::string service =
          text2.empty() ? "A service" : "Service " + Quoted(text2);
      std::string cert =
          text1.empty() ? "a certificate" : "certificate " + Quoted(text1);
      return ok ? service + " now uses " + cert + "."
                : service + " could not be bound to " + cert + ".";
    }
    case 0x12B00009:
      return CertSentence(text1, "Certificate %s was recreated.",
                          "A certificate was recreated.");
    case 0x12B00010:
      return CertSentence(text1, "Certificate %s could not be recreated.",
                          "A certificate could not be recreated.");
    case 0x12B00011:
      return "The certificates were reset to a new default certificate.";
    case 0x12B00012:
      return CertSentence(text1,
                          "The certificates could not be reset: certificate %s "
                          "was not removed.",
                          "The certificates could not be reset.");
    case 0x12B00013: {
      const std::string cert =
          text1.empty() ? "A certificate" : "Certificate " + Quoted(text1);
      const std::string on = text3.empty() ? "" : " on " + text3;
      const std::string users = text2.empty() ? "" : " " + text2 + (text2.find(", ") ==
                                    std::string::npos ? " uses" : " use") + " it.";
      const long days = text4.empty() ? 0 : strtol(text4.c_str(), nullptr, 10);
      if (days < 0) return cert + " expired" + on + " and is not renewed." + users;
      const std::string when =
          days == 0 ? "today" : days == 1 ? "in 1 day" : "in " + text4 + " days";
      return cert + " expires " + when + (on.empty() ? "" : " (" + on.substr(1) + ")") +
             " and will not be renewed automatically." + users;
    }
    default: {
      char text[64];
      snprintf(text, sizeof(text), "Event 0x%08X.", message_id);
      return text;
    }
  }
}

bool ReadEvents(const std::string& path, size_t limit, Json::Value* events) {
  *events = Json::Value(Json::arrayValue);
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return errno == ENOENT;
  while (flock(fd.get(), LOCK_SH) != 0) {
    if (errno != EINTR) return false;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return false;
  const off_t start = st.st_size > kTailBytes ? st.st_size - kTailBytes : 0;
  std::string text(static_cast<size_t>(st.st_size - start), '\0');
  size_t got = 0;
  while (got < text.size()) {
    ssize_t n = pread(fd.get(), &text[got], text.size() - got,
                      start + static_cast<off_t>(got));
    if (n == 0) break;
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    got += static_cast<size_t>(n);
  }
  text.resize(got);
  flock(fd.get(), LOCK_UN);

  // A tail that starts in the middle of a line drops that partial line.
  if (start > 0) {
    const size_t first = text.find('\n');
    text.erase(0, first == std::string::npos ? text.size() : first + 1);
  }
  size_t end = text.size();
  while (end > 0 && events->size() < limit) {
    size_t begin = text.rfind('\n', end - 1);
    begin = begin == std::string::npos ? 0 : begin + 1;
    const std::string line = text.substr(begin, end - begin);
    end = begin > 0 ? begin - 1 : 0;
    Json::Value event;
    if (line.empty() || !JsonParse(line, event) || !event.isObject() ||
        !event["message_id"].isUInt()) {
      continue;
    }
    const int level = event["level"].isInt() ? event["level"].asInt() : 0;
    event["severity"] = level == 1   ? "info"
                        : level == 2 ? "warning"
                        : level == 3 ? "error"
                                     : "notice";
    auto member = [&event](const char* name) {
      return event[name].isString() ? event[name].asString() : "";
    };
    event["message"] = EventSentence(event["message_id"].asUInt(), member("text1"),
                                     member("text2"), member("text3"), member("text4"));
    events->append(event);
  }
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
