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

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_

#include <grpcpp/grpcpp.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <utility>

#include "EtcdMembers.h"
#include "EtcdTlsFiles.h"
#include "EtcdTlsProbe.h"
#include "EtcdWaitBudget.h"
#include "EtcdWire.h"
#include "TavoConfigStore/EtcdStore.h"
#include "etcd/etcdserver/etcdserverpb/rpc.grpc.pb.h"

namespace TavoConfigStore {

class EtcdClient {
 public:
  // Checks the TLS files before anything connects (EtcdTlsFiles.h).
  explicit EtcdClient(const EtcdStoreOptions& options);

  // "etcd HOST:PORT[,...]", for messages.
  const std::string& Where() const { return where_; }

  // "retry": the request may be sent twice (puts of the same bytes, or a
  // transaction guarded by compares that a second attempt would fail), so a
  // member that does not answer in time makes way for the next. Otherwise
  // only a member that could not be connected to is passed over.
  etcdserverpb::TxnResponse Txn(const etcdserverpb::TxnRequest& request, bool retry);
  // Reads, with the reply kept as received (EtcdWire.h); a transaction sent
  // this way must only read.
  void Read(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply);
  void Read(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply);

  std::int64_t LeaseGrant(std::int64_t ttlSeconds);
  void LeaseKeepAlive(std::int64_t lease);
  // Throws unless etcd confirms the lease is gone.
  void LeaseRevoke(std::int64_t lease);

  // One call of the store, for as long as the object lives: the time its
  // requests wait for members that do not answer counts once against the
  // timeout (EtcdWaitBudget.h).
  class Call {
   public:
    explicit Call(EtcdClient& client) : budget_(client.budget_) { budget_.Open(); }
    ~Call() { budget_.Close(); }
    Call(const Call&) = delete;
    Call& operator=(const Call&) = delete;

   private:
    EtcdWaitBudget& budget_;
  };
  // Lets the open call wait up to a second more (a fifth of the timeout when
  // that is less), to learn the outcome of a write whose request failed.
  void AllowSettling();

  // For a stream of one's own (a watch, which has no deadline): the member
  // to hold it on, one that has just answered a read of "key", and
  // "context" readied with the auth token. Throws when no member answers
  // within the timeout.
  etcdserverpb::Watch::Stub& WatchStub(const std::string& key, grpc::ClientContext* context,
                                       std::size_t* member);
  // The stream held on "member" broke: the next goes to another member.
  void StreamLost(std::size_t member) { members_.Stalled(member); }

  // Throws the store's exception for a failed call.
  [[noreturn]] void Fail(const grpc::Status& status, const char* what) const;

 private:
  using Clock = std::chrono::steady_clock;
  enum class Outcome { kAnswer, kUnreachable, kNoAnswer, kBusy };

  // Sends a request, member after member, until one answers or its time is
  // up. "counted": the request belongs to the open call (a watch's does not).
  template <typename Send>
  grpc::Status Invoke(const char* what, bool retry, const Send& send,
                      std::size_t* answeredBy = nullptr, bool counted = true);
  grpc::Status Token(EtcdMember& member, Clock::time_point deadline, std::string* token);
  void ForgetToken();
  Outcome Classify(std::size_t member, const grpc::Status& status, Clock::time_point deadline,
                   TlsFinding* why);
  TlsFinding Diagnose(std::size_t member, const std::string& lastError, Clock::time_point deadline);
  template <typename Request>
  void Receive(grpc::internal::RpcMethod EtcdMember::*method, const Request& request,
               etcdwire::Reply* reply);

  EtcdStoreOptions options_;
  std::string where_;
  TlsMaterial material_;
  EtcdMembers members_;
  EtcdWaitBudget budget_;
  std::mutex tokenMu_;
  std::string token_;
  bool authenticated_ = false;
  // What a handshake of the client's own found for a member's connection
  // error, by member and gRPC's text: asked once, not at every request.
  std::mutex findingsMu_;
  std::map<std::pair<std::size_t, std::string>, TlsFinding> findings_;
};

// The first key after every key that starts with "prefix" (etcd's range end).
std::string PrefixEnd(std::string prefix);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_CLIENT_H_
