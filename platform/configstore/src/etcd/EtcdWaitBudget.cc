#include "EtcdWaitBudget.h"

#include <algorithm>

namespace TavoConfigStore {

void EtcdWaitBudget::Open() {
  std::lock_guard<std::mutex> lock(mu_);
  if (depth_++ > 0) return;
  allowed_ = timeout_;
  spent_ = Clock::duration::zero();
  chargedUntil_ = Clock::time_point();
}

void EtcdWaitBudget::Close() {
  std::lock_guard<std::mutex> lock(mu_);
  --depth_;
}

void EtcdWaitBudget::Extend(std::chrono::milliseconds extra) {
  std::lock_guard<std::mutex> lock(mu_);
  if (depth_ > 0) allowed_ = std::max(allowed_, spent_ + Clock::duration(extra));
}

EtcdWaitBudget::Clock::time_point EtcdWaitBudget::Deadline(Clock::time_point now) const {
  std::lock_guard<std::mutex> lock(mu_);
  if (depth_ == 0) return now + timeout_;
  return now +
         std::min<Clock::duration>(timeout_, std::max(allowed_ - spent_, Clock::duration::zero()));
}

void EtcdWaitBudget::Charge(Clock::time_point start, Clock::time_point end) {
  std::lock_guard<std::mutex> lock(mu_);
  if (depth_ == 0 || end <= chargedUntil_) return;
  spent_ += end - std::max(start, chargedUntil_);
  chargedUntil_ = end;
}

}  // namespace TavoConfigStore
