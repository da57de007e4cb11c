#pragma once
// A fresh folder under the system's temporary folder, removed with
// everything in it when the object goes.

#include <filesystem>
#include <string>

namespace testing_support {

class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::filesystem::path& path() const { return path_; }
  std::filesystem::path operator/(const std::string& name) const { return path_ / name; }

 private:
  std::filesystem::path path_;
};

// Writes text to a file, creating missing folders.
void writeFile(const std::filesystem::path& file, const std::string& text);
// Reads a whole file; throws std::runtime_error when it cannot be opened.
std::string readFile(const std::filesystem::path& file);

}  // namespace testing_support
