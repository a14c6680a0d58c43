// The server's own log: one line per event on standard error, which
// systemd's journal collects. Diagnostics begin with "zeph-webapid: ";
// access lines with "access: ".
//
// Thread-safety: each line goes out with one write(2), so lines of
// concurrent requests never mix.
#ifndef ZEPH_SERVER_LOG_LINE_H_
#define ZEPH_SERVER_LOG_LINE_H_

#include <string>

namespace ZEPH {
namespace webapid {

// Writes "zeph-webapid: <message>\n".
void LogLine(const std::string& message);

// Writes "access: <line>\n".
void AccessLine(const std::string& line);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_LOG_LINE_H_
