#pragma once
// A summary of a plug-in's code signature: its code-directory hash and its
// requirement text.
//
// This platform does not sign code, so the summary is a placeholder: the hash
// is random and unique to each object (the SHA-1 of a fresh UUID's text) and
// the requirement is a fixed text. Both are constant after construction.

#include <memory>
#include <string>

#include "base/Error.h"
#include "lmo/Value.h"
#include "model/FileUrl.h"

namespace vantrel::model {

class VTDPlugInSignature {
 public:
  // Never fails and never writes *error (which may be null); url is not
  // read.
  static std::shared_ptr<VTDPlugInSignature> initWithURL(const FileUrl& url, base::Error* error);

  VTDPlugInSignature();

  // 20 bytes of data.
  const lmo::Value& cdhash() const { return cdhash_; }
  const std::string& requirement() const { return requirement_; }

 private:
  const lmo::Value cdhash_;
  const std::string requirement_;
};

}  // namespace vantrel::model
