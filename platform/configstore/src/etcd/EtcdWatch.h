// Wakes a store's WaitForChange when another writer commits: a watch on the
// pointers, which every commit rewrites, read by a thread of its own. A
// broken stream is opened again from the last revision it saw, on another
// member, and reported as a possible change, so that the caller reads again
// and finds what the cluster holds (or why it cannot).

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_WATCH_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_WATCH_H_

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "EtcdClient.h"

namespace TavoConfigStore {

class ChangeFeed {
 public:
  // Watches the keys under "prefix" from "startRevision" on.
  ChangeFeed(EtcdClient& client, std::string prefix, std::int64_t startRevision);
  ~ChangeFeed();
  ChangeFeed(const ChangeFeed&) = delete;
  ChangeFeed& operator=(const ChangeFeed&) = delete;

  // Whether a change came (since the last call) within "timeoutMs".
  bool Wait(int timeoutMs);

 private:
  void Run();
  void Follow(grpc::ClientContext* context);
  void Signal();

  EtcdClient& client_;
  const std::string prefix_;
  std::int64_t next_;
  std::mutex mu_;
  std::condition_variable changed_;
  bool seen_ = false;
  bool stopping_ = false;
  std::shared_ptr<grpc::ClientContext> context_;
  std::thread thread_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_WATCH_H_
