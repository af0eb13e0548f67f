/// Owners for C resources the queue code opens: a stream closed on every way
/// out of its scope.
#pragma once

#include <cstdio>
#include <memory>

struct FileCloser {
  void operator()(FILE* fp) const {
    if (fp != nullptr) fclose(fp);
  }
};
/// A stream owned by its scope (fclose at the end; null holds nothing).
using ScopedFILE = std::unique_ptr<FILE, FileCloser>;
