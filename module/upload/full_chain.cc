#include "module/upload/full_chain.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include "module/common/log.h"
#include "zeph/unique_fd.h"

namespace {

// Copies `in` to the end of `out`, adding a line feed when the last line
// lacks one. Copying in blocks gives the same bytes as copying line by line
// and puts no limit on the length of a line.
bool AppendLines(FILE* in, FILE* out) {
  char buf[8192];
  char last = '\n';  // an empty file needs no line feed
  size_t n;
  while ((n = fread(buf, 1, sizeof(buf), in)) > 0) {
    if (fwrite(buf, 1, n, out) != n) {
      UPLOAD_LOG("fputc error.");
      return false;
    }
    last = buf[n - 1];
  }
  if (ferror(in)) {
    UPLOAD_LOG("Read CA file failed [%d]", errno);
    return false;
  }
  if (last != '\n' && fputc('\n', out) == EOF) {
    UPLOAD_LOG("fputc error.");
    return false;
  }
  return true;
}

bool AppendFile(const std::string& path, FILE* out) {
  ZEPH::UniqueFile in(fopen(path.c_str(), "re"));
  if (!in) {
    UPLOAD_LOG("Open CA file failed");
    return false;
  }
  return AppendLines(in.get(), out);
}

}  // namespace

bool genChainCRT(const std::string& workDir) {
  const std::string cert = workDir + "/cert.pem";
  const std::string chain = workDir + "/chain.pem";
  const std::string fullchain = workDir + "/fullchain.pem";

  ZEPH::UniqueFile in(fopen(cert.c_str(), "re"));
  if (!in) {
    UPLOAD_LOG("Open CA file failed");
    return false;
  }
  // Owner-only from the start; made read-only once complete.
  ZEPH::UniqueFd fd(open(fullchain.c_str(),
                         O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW,
                         0600));
  if (!fd) {
    UPLOAD_LOG("Open %s failed [%d]", fullchain.c_str(), errno);
    return false;
  }
  ZEPH::UniqueFile out(fdopen(fd.get(), "w"));
  if (!out) {
    UPLOAD_LOG("Open %s failed [%d]", fullchain.c_str(), errno);
    return false;
  }
  fd.release();  // now owned by `out`

  if (!AppendLines(in.get(), out.get())) return false;
  in.reset();
  if (access(chain.c_str(), F_OK) == 0 && !AppendFile(chain, out.get())) {
    return false;
  }
  // Buffered data is written by fclose; its failure is a failed write.
  if (fclose(out.release()) != 0) {
    UPLOAD_LOG("fputc error.");
    return false;
  }
  if (chmod(fullchain.c_str(), 0400) != 0) {
    UPLOAD_LOG("Failed to chmod");
    return false;
  }
  return true;
}
