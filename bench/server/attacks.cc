// The figures behind the server's attack tests, against a running
// zeph-webapid (and its nginx) on 127.0.0.1.
//
//   webapid_bench_attacks --port P --token TOKEN --pid PID --bomb FILE
//                         [--calls N]
//
// PID is zeph-webapid's; the resident memory counted is that of its whole
// process tree (nginx's master and workers included), sampled while each
// attack runs. FILE is a gzip body that unpacks to 300 MB. Then, with 500
// idle connections and 16 slow bodies held open, N authorised "CRT list"
// calls are timed one after the other (p50, p99, max). Prints one
// "result:" line per figure (bench/run gathers them).
#include <arpa/inet.h>
#include <dirent.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace {

using Clock = std::chrono::steady_clock;

int g_port = 0;
std::string g_token;
pid_t g_pid = 0;

std::string ReadText(const std::string& path) {
  ZEPH::UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  std::string text;
  if (fd) ZEPH::ReadAll(fd.get(), text);
  return text;
}

// Resident memory of `g_pid` and every process below it, in KiB.
long TreeRssKiB() {
  std::vector<std::pair<pid_t, pid_t>> procs;  // pid, parent
  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir("/proc"), closedir);
  while (dir) {
    const dirent* e = readdir(dir.get());
    if (e == nullptr) break;
    const pid_t pid = static_cast<pid_t>(atol(e->d_name));
    if (pid <= 0) continue;
    const std::string stat = ReadText("/proc/" + std::to_string(pid) + "/stat");
    const size_t close = stat.rfind(')');
    if (close == std::string::npos || close + 4 > stat.size()) continue;
    procs.emplace_back(pid, static_cast<pid_t>(atol(stat.c_str() + close + 4)));
  }
  std::vector<pid_t> tree = {g_pid};
  for (size_t i = 0; i < tree.size(); ++i) {
    for (const auto& p : procs) {
      if (p.second == tree[i]) tree.push_back(p.first);
    }
  }
  long total = 0;
  for (pid_t pid : tree) {
    const std::string status = ReadText("/proc/" + std::to_string(pid) + "/status");
    const size_t at = status.find("\nVmRSS:");
    if (at != std::string::npos) total += atol(status.c_str() + at + 7);
  }
  return total;
}

ZEPH::UniqueFd ConnectTcp() {
  ZEPH::UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  timeval tv = {15, 0};
  sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(g_port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (!fd || setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv)) != 0 ||
      setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv)) != 0 ||
      connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    return ZEPH::UniqueFd();
  }
  return fd;
}

// One HTTP/1.1 connection over TLS.
class Tls {
 public:
  Tls() : ctx_(SSL_CTX_new(TLS_client_method()), SSL_CTX_free),
          ssl_(nullptr, SSL_free), fd_(ConnectTcp()) {
    if (!ctx_ || !fd_) return;
    ssl_.reset(SSL_new(ctx_.get()));
    if (!ssl_ || SSL_set_fd(ssl_.get(), fd_.get()) != 1 ||
        SSL_connect(ssl_.get()) != 1) {
      ssl_.reset();
      ERR_clear_error();
    }
  }
  bool ok() const { return ssl_ != nullptr; }
  bool Send(const std::string& data) {
    size_t done = 0;
    while (ok() && done < data.size()) {
      const int n = SSL_write(ssl_.get(), data.data() + done,
                              static_cast<int>(std::min<size_t>(data.size() - done, 1 << 20)));
      if (n <= 0) return false;
      done += static_cast<size_t>(n);
    }
    return ok();
  }
  // The status of the next answer, reading its body to the end (by its
  // Content-Length); 0 when none came.
  int Answer() {
    std::string in;
    char buf[16384];
    size_t end;
    while ((end = in.find("\r\n\r\n")) == std::string::npos) {
      const int n = ok() ? SSL_read(ssl_.get(), buf, sizeof(buf)) : 0;
      if (n <= 0) return 0;
      in.append(buf, static_cast<size_t>(n));
    }
    const size_t cl = in.find("Content-Length: ");
    size_t want = cl != std::string::npos && cl < end ? strtoul(in.c_str() + cl + 16, nullptr, 10) : 0;
    size_t have = in.size() - end - 4;
    while (have < want) {
      const int n = SSL_read(ssl_.get(), buf, sizeof(buf));
      if (n <= 0) break;
      have += static_cast<size_t>(n);
    }
    return in.compare(0, 9, "HTTP/1.1 ") == 0 ? atoi(in.c_str() + 9) : 0;
  }

 private:
  std::unique_ptr<SSL_CTX, void (*)(SSL_CTX*)> ctx_;
  std::unique_ptr<SSL, void (*)(SSL*)> ssl_;
  ZEPH::UniqueFd fd_;
};

const std::string kList = "/api/ZEPH.Core.Certificate.CRT/1/list";

std::string Post(const std::string& path, const std::string& body,
                 const std::string& extra = "") {
  return "POST " + path + " HTTP/1.1\r\nHost: x\r\nAuthorization: Bearer " +
         g_token + "\r\nContent-Type: application/json\r\n" + extra +
         "Content-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body;
}

std::string Repeat(const std::string& piece, size_t times) {
  std::string out;
  for (size_t i = 0; i < times; ++i) out += piece;
  return out;
}

void Result(const std::string& what, double value, const char* unit) {
  printf("%-58s %10.1f %s\n", what.c_str(), value, unit);
  printf("result: server attacks | %s | %.1f | %s\n", what.c_str(), value, unit);
}

// Runs `attack`, sampling the tree's memory every 20 ms meanwhile; the peak.
long PeakDuring(const std::function<void(const std::function<void()>&)>& attack) {
  long peak = TreeRssKiB();
  auto last = Clock::now();
  attack([&] {
    if (Clock::now() - last < std::chrono::milliseconds(20)) return;
    last = Clock::now();
    peak = std::max(peak, TreeRssKiB());
  });
  return std::max(peak, TreeRssKiB());
}

// Sends `head`, `piece` up to `times` times (while the server reads), `tail`.
void Stream(const std::string& head, const std::string& piece, size_t times,
            const std::string& tail, const std::function<void()>& sample) {
  Tls tls;
  bool open = tls.Send(head);
  for (size_t i = 0; open && i < times; ++i) {
    open = tls.Send(piece);
    sample();
  }
  if (open) tls.Send(tail);
}

double ListMs() {
  Tls tls;
  const auto start = Clock::now();
  const bool ok = tls.Send(Post(kList, "{}")) && tls.Answer() == 200;
  const double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
  return ok ? ms : -1;
}

}  // namespace

int main(int argc, char** argv) {
  std::string bomb_path;
  long calls = 30;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string arg = argv[i];
    if (arg == "--port") g_port = atoi(argv[i + 1]);
    else if (arg == "--token") g_token = argv[i + 1];
    else if (arg == "--pid") g_pid = static_cast<pid_t>(atol(argv[i + 1]));
    else if (arg == "--bomb") bomb_path = argv[i + 1];
    else if (arg == "--calls") calls = atol(argv[i + 1]);
  }
  if (g_port <= 0 || g_token.empty() || g_pid <= 0 || bomb_path.empty()) {
    fprintf(stderr, "usage: webapid_bench_attacks --port P --token T --pid PID --bomb FILE [--calls N]\n");
    return 2;
  }
  signal(SIGPIPE, SIG_IGN);
  const std::string mib(1 << 20, 'a');
  const std::string bomb = ReadText(bomb_path);
  struct Attack {
    const char* name;
    std::function<void(const std::function<void()>&)> run;
  };
  const Attack attacks[] = {
      {"chunked body of 200 MB to /",
       [&](const std::function<void()>& s) {
         Stream("POST / HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n",
                "100000\r\n" + mib + "\r\n", 200, "0\r\n\r\n", s);
       }},
      {"chunked body of 200 MB to the API, no token",
       [&](const std::function<void()>& s) {
         Stream("POST " + kList + " HTTP/1.1\r\nHost: x\r\nTransfer-Encoding: chunked\r\n\r\n",
                "100000\r\n" + mib + "\r\n", 200, "0\r\n\r\n", s);
       }},
      {"4 gzip bodies unpacking to 300 MB each",
       [&](const std::function<void()>& s) {
         std::vector<std::unique_ptr<Tls>> conns;
         for (int i = 0; i < 4; ++i) {
           conns.emplace_back(new Tls);
           conns.back()->Send(Post(kList, bomb, "Content-Encoding: gzip\r\n"));
           s();
         }
         for (auto& c : conns) c->Answer();
       }},
      {"2,700 ranges of /app.js",
       [&](const std::function<void()>& s) {
         Tls tls;
         tls.Send("GET /app.js HTTP/1.1\r\nHost: x\r\nRange: bytes=" +
                  Repeat("0-19999,", 2699) + "0-19999\r\n\r\n");
         tls.Answer();
         s();
       }},
      {"100 ranges over all of /app.js",
       [&](const std::function<void()>& s) {
         Tls tls;
         tls.Send("GET /app.js HTTP/1.1\r\nHost: x\r\nRange: bytes=" + Repeat("0-,", 99) + "0-\r\n\r\n");
         tls.Answer();
         s();
       }},
      {"request line of 200 MB",
       [&](const std::function<void()>& s) {
         Stream("GET /", mib, 200, " HTTP/1.1\r\nHost: x\r\n\r\n", s);
       }},
      {"20 MB of headers",
       [&](const std::function<void()>& s) {
         Stream("GET / HTTP/1.1\r\nHost: x\r\n",
                Repeat("X-Pad: " + std::string(100, 'b') + "\r\n", 10000), 20, "\r\n", s);
       }},
  };
  Result("tree RSS idle", TreeRssKiB() / 1024.0, "MiB");
  for (const Attack& attack : attacks) {
    Result(std::string("tree RSS peak, ") + attack.name, PeakDuring(attack.run) / 1024.0, "MiB");
  }

  // 500 idle connections and 16 slow uploads held open meanwhile.
  std::vector<ZEPH::UniqueFd> idle;
  for (int i = 0; i < 500; ++i) idle.push_back(ConnectTcp());
  std::vector<std::unique_ptr<Tls>> slow;
  for (int i = 0; i < 16; ++i) {
    slow.emplace_back(new Tls);
    slow.back()->Send(
        "POST /api/ZEPH.Core.Certificate/1/import HTTP/1.1\r\nHost: x\r\n"
        "Authorization: Bearer " + g_token + "\r\n"
        "Content-Type: multipart/form-data; boundary=B\r\n"
        "Content-Length: 1000000\r\n\r\n--B\r\n");
  }
  std::vector<double> ms;
  long failed = 0;
  for (long i = 0; i < calls; ++i) {
    const double t = ListMs();
    if (t < 0) ++failed;
    else ms.push_back(t);
    for (auto& s : slow) s->Send("k");  // the slow bodies trickle on
  }
  std::sort(ms.begin(), ms.end());
  auto at = [&](double q) { return ms.empty() ? -1.0 : ms[static_cast<size_t>(q * (ms.size() - 1))]; };
  Result("CRT list under 500 idle + 16 slow bodies, p50", at(0.5), "ms");
  Result("CRT list under 500 idle + 16 slow bodies, p99", at(0.99), "ms");
  Result("CRT list under 500 idle + 16 slow bodies, max", at(1.0), "ms");
  Result("CRT list under 500 idle + 16 slow bodies, failed", static_cast<double>(failed), "calls");
  Result("tree RSS with 500 idle + 16 slow bodies", TreeRssKiB() / 1024.0, "MiB");
  return 0;
}
