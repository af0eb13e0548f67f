// What the fuzzers share: a scratch directory, and the end of the run when a
// property breaks.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>

namespace fuzz {

/// Aborts, saying which property broke, unless `ok`.
inline void require(bool ok, const char* what) {
  if (ok) return;
  fprintf(stderr, "broken: %s\n", what);
  abort();
}

/// A fresh directory under /tmp.
inline std::string scratch_dir(const char* prefix) {
  std::string dir = std::string("/tmp/") + prefix + "_XXXXXX";
  require(mkdtemp(dir.data()) != nullptr, "no scratch directory");
  return dir;
}

}  // namespace fuzz
