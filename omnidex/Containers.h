#pragma once
// Plug-in data containers: "<state>/containers/<UUID>/" (mode 0700) with a
// "tmp/" child, one per registered plug-in, named by its UUID so that no
// bundle-controlled text ever becomes part of the path.

#include <string>
#include <unordered_set>
#include <utility>

#include "base/Result.h"
#include "base/Uuid.h"

namespace vantrel::omnidex {

class Containers {
 public:
  // root: the directory that holds the containers; made (0700) by open().
  explicit Containers(std::string root) : root_(std::move(root)) {}

  // Makes root when it is missing. Errors: domain "POSIX".
  base::Result<void> open() const;

  std::string pathFor(const base::Uuid& uuid) const;

  // Makes the container of uuid (and its tmp/) when missing and returns its
  // path. A symbolic link or other non-directory in the way is an error, not
  // followed. Errors: domain "POSIX".
  base::Result<std::string> ensure(const base::Uuid& uuid) const;

  // The UUIDs of the directories in root now (the containers that exist),
  // read in one pass; empty when root cannot be read. Loading the registry
  // takes a container named here as it is, instead of checking each one
  // with four system calls.
  std::unordered_set<base::Uuid> existing() const;

  // Removes the container of uuid with everything in it; a missing container
  // is no error. Symbolic links inside are removed, not followed.
  base::Result<void> remove(const base::Uuid& uuid) const;

 private:
  const std::string root_;  // Constant after construction.
};

}  // namespace vantrel::omnidex
