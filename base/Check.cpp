#include "base/Check.h"

#include <cstdio>
#include <cstdlib>

#include "base/Format.h"
#include "base/Log.h"

namespace vantrel::base {

void internalInconsistency(const char* what, const char* file, int line) {
  std::string text = format("internal inconsistency: %s (%s:%d)", what, file, line);
  writeLog(LogLevel::kError, text);
  std::fprintf(stderr, "%s\n", text.c_str());
  std::fflush(stderr);
  std::abort();
}

}  // namespace vantrel::base
