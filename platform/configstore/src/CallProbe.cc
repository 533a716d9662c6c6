#include "TavoConfigStore/CallProbe.h"

#include <algorithm>
#include <atomic>

#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {

namespace {
// The flag keeps the common case (no probe) to one relaxed load.
std::atomic<bool> gProbeInstalled{false};
std::mutex gProbeMu;
std::shared_ptr<CallProbe> gProbe;
}  // namespace

CallProbe::~CallProbe() = default;

void InstallCallProbe(std::shared_ptr<CallProbe> probe) {
  std::lock_guard<std::mutex> lock(gProbeMu);
  gProbeInstalled.store(probe != nullptr, std::memory_order_release);
  gProbe = std::move(probe);
}

void NotifyCall(const char* operation) {
  if (!gProbeInstalled.load(std::memory_order_acquire)) return;
  std::shared_ptr<CallProbe> probe;
  {
    std::lock_guard<std::mutex> lock(gProbeMu);
    probe = gProbe;
  }
  if (probe) probe->OnCall(operation);
}

void FaultInjector::FailStoreError(const std::string& operation, int nth,
                                   const std::string& message, std::int32_t code, bool persistent) {
  FailWith(
      operation, nth, [message, code] { throw ConfigStoreException(message, code); }, persistent);
}

void FaultInjector::FailWith(const std::string& operation, int nth, std::function<void()> thrower,
                             bool persistent) {
  std::lock_guard<std::mutex> lock(mu_);
  faults_.push_back(Fault{operation, nth, persistent, std::move(thrower)});
}

void FaultInjector::ClearFaults() {
  std::lock_guard<std::mutex> lock(mu_);
  faults_.clear();
}

std::vector<std::string> FaultInjector::Calls() const {
  std::lock_guard<std::mutex> lock(mu_);
  return log_;
}

std::vector<std::string> FaultInjector::Calls(const std::vector<std::string>& operations) const {
  std::lock_guard<std::mutex> lock(mu_);
  std::vector<std::string> out;
  for (const std::string& call : log_) {
    if (std::find(operations.begin(), operations.end(), call) != operations.end()) {
      out.push_back(call);
    }
  }
  return out;
}

int FaultInjector::Count(const std::string& operation) const {
  std::lock_guard<std::mutex> lock(mu_);
  auto it = counts_.find(operation);
  return it == counts_.end() ? 0 : it->second;
}

void FaultInjector::ClearLog() {
  std::lock_guard<std::mutex> lock(mu_);
  log_.clear();
  counts_.clear();
}

void FaultInjector::OnCall(const char* operation) {
  std::function<void()> thrower;
  {
    std::lock_guard<std::mutex> lock(mu_);
    log_.emplace_back(operation);
    const int seen = ++counts_[log_.back()];
    for (const Fault& f : faults_) {
      if (f.operation == operation && (seen == f.nth || (f.persistent && seen > f.nth))) {
        thrower = f.thrower;
        break;
      }
    }
  }
  if (thrower) thrower();
}

const std::vector<std::string>& StoreOperations() {
  static const std::vector<std::string> kOps = {
      "GetStore",   "GetObject",        "SetObject",         "DeleteObjects",
      "GetObjects", "BeginTransaction", "CommitTransaction", "AbortTransaction"};
  return kOps;
}

}  // namespace TavoConfigStore
