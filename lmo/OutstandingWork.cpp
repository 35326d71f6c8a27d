#include "lmo/OutstandingWork.h"

#include <atomic>

#include "base/Check.h"

namespace vantrel::lmo {
namespace {

std::atomic<uint64_t> gOutstanding{0};

}  // namespace

void OutstandingWork::begin() {
  gOutstanding.fetch_add(1, std::memory_order_relaxed);
}

void OutstandingWork::end() {
  uint64_t before = gOutstanding.fetch_sub(1, std::memory_order_relaxed);
  VT_CHECK(before != 0, "outstanding work ended more often than begun");
}

uint64_t OutstandingWork::count() {
  return gOutstanding.load(std::memory_order_relaxed);
}

}  // namespace vantrel::lmo
