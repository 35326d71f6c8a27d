#pragma once
// Holder of one sandbox extension token: consumed at most once in this
// process, released again by expel() or when the holder goes away.
//
// Safe to use from several threads without a lock: the handle is one atomic
// 64-bit value, and concurrent consumes or expels never leak or double-free a
// handle.

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

namespace vantrel::model {

class VTSandboxExtension {
 public:
  // Stores the token; nothing is consumed yet (handle 0).
  static std::shared_ptr<VTSandboxExtension> initWithExtension(std::string token);

  explicit VTSandboxExtension(std::string token);
  // Expels first, so a consumed extension never outlives its holder.
  ~VTSandboxExtension();
  VTSandboxExtension(const VTSandboxExtension&) = delete;
  VTSandboxExtension& operator=(const VTSandboxExtension&) = delete;

  const std::string& token() const { return token_; }
  // 0 while not consumed; otherwise whatever the consume returned (-1 when
  // the service refused the token, which still counts as consumed: the
  // holder does not retry).
  int64_t handle() const { return handle_.load(); }

  // Consumes the token when the handle is 0; otherwise does nothing.
  void consume();
  // Sets the handle to 0, releasing it first when it is a real one (> 0);
  // on a holder never consumed it does nothing.
  void expel();

 private:
  const std::string token_;
  std::atomic<int64_t> handle_{0};
};

}  // namespace vantrel::model
