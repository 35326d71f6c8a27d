#pragma once
// Sets (or, given nullopt, unsets) an environment variable for the object's
// life, then restores what it was. Tests only: setenv is not safe while other
// threads read the environment, so use it where no such thread runs.

#include <cstdlib>
#include <optional>
#include <string>

namespace vantrel::testing {

class ScopedEnvironment {
 public:
  ScopedEnvironment(const char* name, std::optional<std::string> value) : name_(name) {
    if (const char* old = std::getenv(name)) old_ = old;
    value ? ::setenv(name, value->c_str(), 1) : ::unsetenv(name);
  }
  // A null value unsets.
  ScopedEnvironment(const char* name, const char* value)
      : ScopedEnvironment(name, value ? std::optional<std::string>(value) : std::nullopt) {}
  ~ScopedEnvironment() { old_ ? ::setenv(name_, old_->c_str(), 1) : ::unsetenv(name_); }
  ScopedEnvironment(const ScopedEnvironment&) = delete;
  ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

 private:
  const char* name_;
  std::optional<std::string> old_;
};

}  // namespace vantrel::testing
