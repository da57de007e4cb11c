// Contents from and to files or the standard streams.

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>

#include "client/cvdb/tool.h"

namespace cvdb::tool {
namespace {

struct FileCloser {
  void operator()(std::FILE* f) const noexcept { std::fclose(f); }
};

}  // namespace

SharedMemBuffer readInput(const std::string& pathOrDash) {
  std::unique_ptr<std::FILE, FileCloser> owned;
  std::FILE* in = stdin;
  if (pathOrDash != "-") {
    owned.reset(std::fopen(pathOrDash.c_str(), "rb"));
    if (!owned) throw UsageError("cannot open \"" + pathOrDash + "\": " + std::strerror(errno));
    in = owned.get();
  }
  std::string bytes;
  char chunk[65536];
  std::size_t n;
  while ((n = std::fread(chunk, 1, sizeof(chunk), in)) > 0) bytes.append(chunk, n);
  if (std::ferror(in)) throw UsageError("cannot read \"" + pathOrDash + "\"");
  return SharedMemBuffer(MemBuffer::copyOf(bytes));
}

void writeOutput(const std::string& pathOrDash, const SharedMemBuffer& content) {
  std::unique_ptr<std::FILE, FileCloser> owned;
  std::FILE* out = stdout;
  if (pathOrDash != "-") {
    owned.reset(std::fopen(pathOrDash.c_str(), "wb"));
    if (!owned) throw UsageError("cannot write \"" + pathOrDash + "\": " + std::strerror(errno));
    out = owned.get();
  }
  if (!content.empty() && std::fwrite(content.data(), 1, content.size(), out) != content.size()) {
    throw UsageError("cannot write \"" + pathOrDash + "\"");
  }
  if (std::fflush(out) != 0) throw UsageError("cannot write \"" + pathOrDash + "\"");
  if (owned && std::fclose(owned.release()) != 0) throw UsageError("cannot write \"" + pathOrDash + "\"");
}

}  // namespace cvdb::tool
