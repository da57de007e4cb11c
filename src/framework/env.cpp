// The helpers that every Env shares, built on its virtual members.

#include "framework/env.h"

#include <memory>
#include <system_error>

namespace sys {
namespace {

constexpr std::size_t kCopyChunk = std::size_t{1} << 20;

}  // namespace

std::string Env::readFile(const Path& path) {
  const auto file = open(path, OpenMode::Read);
  std::string content(static_cast<std::size_t>(file->size()), '\0');
  std::size_t done = 0;
  while (done < content.size()) {
    const std::size_t n = file->read(content.data() + done, content.size() - done);
    if (n == 0) break;  // shrank meanwhile
    done += n;
  }
  content.resize(done);
  // A file that grew meanwhile is read to its end.
  char more[4096];
  for (std::size_t n; (n = file->read(more, sizeof more)) > 0;) content.append(more, n);
  return content;
}

std::int64_t Env::nowSeconds() {
  return std::chrono::duration_cast<std::chrono::seconds>(now().time_since_epoch()).count();
}

void Env::writeFileDurably(const Path& path, std::string_view content) {
  Path temp;
  auto file = createTemp(path.parent_path(), ".cvtmp.", &temp);
  try {
    file->write(content.data(), content.size());
    file->sync();
    file->close();
    rename(temp, path);
  } catch (...) {
    try {
      remove(temp);
    } catch (const std::system_error&) {
      // The first failure is the one to report.
    }
    throw;
  }
  syncFolder(path.parent_path());
}

std::uint64_t Env::copyFile(const Path& from, const Path& to) {
  const auto in = open(from, OpenMode::Read);
  const auto out = open(to, OpenMode::CreateOrTruncate);
  const auto buffer = std::make_unique<char[]>(kCopyChunk);
  std::uint64_t copied = 0;
  for (std::size_t n; (n = in->read(buffer.get(), kCopyChunk)) > 0;) {
    out->write(buffer.get(), n);
    copied += n;
  }
  out->sync();
  out->close();
  return copied;
}

}  // namespace sys
