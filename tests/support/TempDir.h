#pragma once
// A fresh directory under $TMPDIR (or /tmp), removed with everything in it
// when the object goes away.

#include <filesystem>
#include <string>

namespace vantrel::testing {

class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::filesystem::path& path() const { return path_; }
  // path()/relative, as a string.
  std::string file(const std::string& relative) const;
  // Writes text to path()/relative, creating parent directories.
  std::string write(const std::string& relative, const std::string& text) const;

 private:
  std::filesystem::path path_;
};

// The source tree (for examples/ and fixtures), from VANTREL_SOURCE_DIR.
std::filesystem::path sourceDir();

}  // namespace vantrel::testing
