#include "tests/support/TempDir.h"

#include <stdlib.h>

#include <cstdlib>
#include <fstream>
#include <stdexcept>

namespace vantrel::testing {

TempDir::TempDir() {
  const char* base = std::getenv("TMPDIR");
  std::string pattern = std::string(base && *base ? base : "/tmp") + "/vantrel-test-XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) std::abort();
  // Canonical, so that paths the code resolves compare equal to ours.
  path_ = std::filesystem::canonical(pattern);
}

TempDir::~TempDir() {
  std::error_code ec;
  std::filesystem::permissions(path_, std::filesystem::perms::owner_all,
                               std::filesystem::perm_options::add, ec);
  std::filesystem::remove_all(path_, ec);
}

std::string TempDir::file(const std::string& relative) const {
  return (path_ / relative).string();
}

std::string TempDir::write(const std::string& relative, const std::string& text) const {
  std::filesystem::path p = path_ / relative;
  std::filesystem::create_directories(p.parent_path());
  std::ofstream out(p, std::ios::binary | std::ios::trunc);
  out << text;
  return p.string();
}

std::filesystem::path sourceDir() {
  const char* dir = std::getenv("VANTREL_SOURCE_DIR");
  return dir ? std::filesystem::path(dir) : std::filesystem::current_path();
}

}  // namespace vantrel::testing
