// How long one call of the store may still wait for members that do not
// answer. A call may send many requests, some at once; the time its failed
// attempts took counts once against the locator's timeout, so a member
// found hung by one request cannot cost every later request the same wait.
// Answers do not count: a large replace that keeps getting answers takes as
// long as it takes.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_WAIT_BUDGET_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_WAIT_BUDGET_H_

#include <chrono>
#include <mutex>

namespace TavoConfigStore {

class EtcdWaitBudget {
 public:
  using Clock = std::chrono::steady_clock;

  explicit EtcdWaitBudget(std::chrono::milliseconds timeout) : timeout_(timeout) {}

  // Calls nest; the outermost one counts. Outside a call each request has
  // the whole timeout.
  void Open();
  void Close();
  // Lets the open call wait "extra" longer: the requests that settle the
  // outcome of a write whose own request failed.
  void Extend(std::chrono::milliseconds extra);

  // The deadline of a request that starts at "now".
  Clock::time_point Deadline(Clock::time_point now) const;
  // An attempt from "start" to "end" failed. Attempts that overlap in time
  // count once.
  void Charge(Clock::time_point start, Clock::time_point end);

 private:
  const std::chrono::milliseconds timeout_;
  mutable std::mutex mu_;
  int depth_ = 0;
  Clock::duration allowed_{};
  Clock::duration spent_{};
  Clock::time_point chargedUntil_{};
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_WAIT_BUDGET_H_
