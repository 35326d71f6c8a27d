#include "model/FileUrl.h"

namespace vantrel::model {

std::string describe(const FileUrl& url) {
  return "file://" + url.path();
}

}  // namespace vantrel::model
