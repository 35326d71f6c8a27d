#include "fuzz/FuzzSupport.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <system_error>

#include "base/Log.h"

namespace vantrel::fuzz {
namespace {

namespace fs = std::filesystem;

bool sameNumber(double a, double b) {
  return a == b || (std::isnan(a) && std::isnan(b));
}

void removeScratch() {
  std::error_code ec;
  fs::remove_all(scratchDirectory(), ec);
}

}  // namespace

std::vector<std::string_view> splitParts(const uint8_t* data, size_t size, size_t count) {
  std::string_view rest(reinterpret_cast<const char*>(data), size);
  std::vector<std::string_view> parts;
  while (parts.size() + 1 < count) {
    const size_t at = rest.find(kPartSeparator);
    if (at == std::string_view::npos) break;
    parts.push_back(rest.substr(0, at));
    rest.remove_prefix(at + kPartSeparator.size());
  }
  parts.push_back(rest);
  parts.resize(count);
  return parts;
}

const std::string& scratchDirectory() {
  static const std::string directory = [] {
    const char* tmp = std::getenv("TMPDIR");
    std::string pattern = std::string(tmp != nullptr && tmp[0] == '/' ? tmp : "/tmp") +
                          "/vantrel-fuzz.XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) {
      std::perror("vantrel fuzz: cannot make a scratch directory");
      std::abort();
    }
    return pattern;
  }();
  return directory;
}

void setUpProcess() {
  static const bool done = [] {
    base::setLogSink([](base::LogLevel, std::string_view) {});
    const std::string& scratch = scratchDirectory();
    std::atexit(removeScratch);
    const std::pair<const char*, const char*> directories[] = {
        {"VANTREL_STATE_DIR", "state"},        {"VANTREL_RUNTIME_DIR", "run"},
        {"VANTREL_PREFERENCES_DIR", "prefs"},  {"VANTREL_SDK_DIRS", "sdks"},
        {"VANTREL_SYSTEM_DIR", "System"},      {"HOME", "home"},
        {"XDG_STATE_HOME", "home/state"},      {"XDG_RUNTIME_DIR", "run"},
        {"XDG_CONFIG_HOME", "home/config"},
    };
    for (const auto& [variable, name] : directories) {
      const std::string path = scratch + "/" + name;
      std::error_code ec;
      fs::create_directories(path, ec);
      ::setenv(variable, path.c_str(), 1);
    }
    return true;
  }();
  (void)done;
}

void writeFile(const std::string& path, std::string_view bytes) {
  std::error_code ec;
  fs::create_directories(fs::path(path).parent_path(), ec);
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  out.close();
  if (!out) propertyFailed("the scratch directory is writable", path);
  fs::permissions(path, fs::perms(0644), ec);
}

bool sameValue(const lmo::Value& a, const lmo::Value& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case lmo::Value::Type::kReal:
      return sameNumber(*a.getIfReal(), *b.getIfReal());
    case lmo::Value::Type::kDate:
      return sameNumber(a.getIfDate()->secondsSince1970, b.getIfDate()->secondsSince1970);
    case lmo::Value::Type::kArray: {
      const lmo::Array& x = *a.getIfArray();
      const lmo::Array& y = *b.getIfArray();
      if (x.size() != y.size()) return false;
      for (size_t i = 0; i < x.size(); ++i) {
        if (!sameValue(x[i], y[i])) return false;
      }
      return true;
    }
    case lmo::Value::Type::kDictionary: {
      const lmo::Dictionary& x = *a.getIfDictionary();
      const lmo::Dictionary& y = *b.getIfDictionary();
      if (x.size() != y.size()) return false;
      for (const auto& [key, value] : x) {
        const lmo::Value* other = y.find(key);
        if (other == nullptr || !sameValue(value, *other)) return false;
      }
      return true;
    }
    default:
      return a == b;
  }
}

void propertyFailed(const char* property, const std::string& detail) {
  std::fprintf(stderr, "fuzz property failed: %s\n%s\n", property, detail.c_str());
  std::fflush(stderr);
  std::abort();
}

}  // namespace vantrel::fuzz
