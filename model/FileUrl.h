#pragma once
// A file URL: the location of a bundle or file, held as its file-system path.
//
// The path is kept exactly as given (no canonicalisation, no trailing-slash
// rule), so two URLs are equal exactly when their paths are the same text.
// Log lines print a URL as "file://<path>".

#include <string>
#include <utility>

namespace vantrel::model {

class FileUrl {
 public:
  static FileUrl fromPath(std::string path) { return FileUrl(std::move(path)); }

  const std::string& path() const { return path_; }
  bool operator==(const FileUrl&) const = default;

 private:
  explicit FileUrl(std::string path) : path_(std::move(path)) {}
  std::string path_;
};

// "file://" followed by the path; what %@ prints for a URL.
std::string describe(const FileUrl& url);

}  // namespace vantrel::model
