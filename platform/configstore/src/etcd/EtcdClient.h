// A synchronous client for the parts of etcd's v3 API the store uses, with
// the store's error reporting: every failure becomes a ConfigStoreException
// whose message names the cluster and whose code is kErrorEtcdBase plus the
// gRPC status code, or a kErrorTls... code for what TLS found wrong.
//
// Each member has a channel of its own. A request goes first to the member
// that answered last; a member that refuses the connection is passed over
// at once, one that does not answer after about a second (or a member that
// is electing a leader) makes way for the next, in rounds that give each
// member longer, until the request's one deadline. When every member
// refuses, the request fails at once and says why for each.
//
// That is the one retry policy, and it holds for every call: each request
// the store sends is safe to send twice. Reads are; puts write the same
// bytes again; deletes delete nothing more; every transaction that writes
// is guarded by compares a second copy would fail (a commit then reads its
// pointer back to learn whether its first copy took effect); a lease
// granted twice leaves one unused that runs out; revoking or renewing a
// lease twice does what once did.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_

#include <grpcpp/grpcpp.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

#include "EtcdMembers.h"
#include "EtcdTlsFiles.h"
#include "EtcdTlsProbe.h"
#include "EtcdWire.h"
#include "TavoConfigStore/EtcdStore.h"
#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace TavoConfigStore {

// The code of a failure etcd or gRPC reported with "status".
constexpr std::int32_t EtcdCode(grpc::StatusCode status) {
  return kErrorEtcdBase + static_cast<std::int32_t>(status);
}

class EtcdClient {
 public:
  using WatchStream =
      grpc::ClientReaderWriter<etcdserverpb::WatchRequest, etcdserverpb::WatchResponse>;

  // Checks the TLS files before anything connects (EtcdTlsFiles.h).
  explicit EtcdClient(const EtcdStoreOptions& options);

  // "etcd HOST:PORT[,...]", for messages.
  const std::string& Where() const { return where_; }

  // The reply is kept as received and read in place (EtcdWire.h); it holds
  // one range for each operation of the branch a transaction took.
  void Range(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply);
  void Txn(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply);
  // Whether the transaction's compares held.
  bool Txn(const etcdserverpb::TxnRequest& request);

  std::int64_t LeaseGrant(std::int64_t ttlSeconds);
  // Throws with kErrorEtcdBase + NOT_FOUND when the lease is gone.
  void LeaseKeepAlive(std::int64_t lease);
  // Throws unless etcd confirms the lease is gone.
  void LeaseRevoke(std::int64_t lease);

  // One call of the store (or one transaction), for as long as the object
  // lives: the time its requests wait for members that do not answer counts
  // once against the timeout, so a member found hung by one request cannot
  // cost every later request the same wait; answers do not count. Calls
  // nest; the outermost one counts. Outside a call each request has the
  // whole timeout.
  class Call {
   public:
    explicit Call(EtcdClient& client);
    ~Call();
    Call(const Call&) = delete;
    Call& operator=(const Call&) = delete;

   private:
    EtcdClient& client_;
  };
  // Lets the open call wait up to a second more (a fifth of the timeout when
  // that is less), to learn the outcome of a write whose request failed.
  void AllowSettling();

  // A watch stream (which has no deadline) on a member that has just
  // answered a read of "key", with the auth token; "*member" is that member.
  // Throws when no member answers within the timeout.
  std::unique_ptr<WatchStream> Watch(const std::string& key, grpc::ClientContext* context,
                                     std::size_t* member);
  // The stream held on "member" broke: the next goes to another member.
  void StreamLost(std::size_t member) { members_.Stalled(member); }

 private:
  using Clock = std::chrono::steady_clock;
  enum class Outcome { kAnswer, kUnreachable, kNoAnswer, kBusy };

  // Sends a unary request by name and returns its reply's bytes.
  grpc::Slice Unary(const char* what, const char* method,
                    const grpc::protobuf::MessageLite& request);
  // Sends a request, member after member, until one answers or its time is
  // up. "counted": the request belongs to the open call (a watch's does not).
  template <typename Send>
  grpc::Status Invoke(const char* what, const Send& send, std::size_t* answeredBy = nullptr,
                      bool counted = true);
  grpc::Status Token(EtcdMember& member, Clock::time_point deadline, std::string* token);
  Outcome Classify(std::size_t member, const grpc::Status& status, Clock::time_point deadline,
                   TlsFinding* why);
  TlsFinding Diagnose(std::size_t member, const std::string& lastError, Clock::time_point deadline);
  [[noreturn]] void Fail(const grpc::Status& status, const char* what) const;

  // The deadline of a request that starts now, and the time an attempt of
  // the open call spent without an answer; attempts that overlap in time
  // count once.
  Clock::time_point Deadline();
  void Charge(Clock::time_point start, Clock::time_point end);

  EtcdStoreOptions options_;
  std::string where_;
  TlsMaterial material_;
  EtcdMembers members_;
  std::mutex tokenMu_;
  std::string token_;
  bool authenticated_ = false;
  // What a handshake of the client's own found for a member's connection
  // error, by member and gRPC's text: asked once, not at every request.
  std::mutex findingsMu_;
  std::map<std::pair<std::size_t, std::string>, TlsFinding> findings_;
  // The open call's wait (Call).
  std::mutex budgetMu_;
  int callDepth_ = 0;
  Clock::duration allowed_{};
  Clock::duration spent_{};
  Clock::time_point chargedUntil_{};
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
