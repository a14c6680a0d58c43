#include "zeph/root.h"

#include <stdlib.h>

namespace ZEPH {

std::string RootDir() {
  const char* env = getenv("ZEPH_ROOT");
  std::string root = env != nullptr ? env : "";
  while (!root.empty() && root.back() == '/') root.pop_back();
  return root;
}

std::string RootPath(const std::string& path) {
  if (path.empty() || path[0] != '/') return path;
  return RootDir() + path;
}

}  // namespace ZEPH
