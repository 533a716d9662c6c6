#include "EtcdClient.h"

#include <algorithm>
#include <cstring>
#include <thread>
#include <vector>

namespace TavoConfigStore {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

// The first round gives each member this long to answer (half the timeout
// when that is less), each later round twice as long as the one before: a
// hung member holds a request about a second, and a slow but healthy one
// still gets the time a large reply needs.
constexpr milliseconds kFirstAttempt{1000};
// After a round in which every member said "not now" (an election under
// way), the next starts after this pause.
constexpr milliseconds kBetweenRounds{50};
// A connection of the client's own, to tell why TLS failed, or whether a
// member said to refuse does.
constexpr milliseconds kProbeLimit{1000};
constexpr char kRefused[] = "connection refused";
// What a call may wait beyond its timeout to settle a failed write.
constexpr milliseconds kSettling{1000};

std::chrono::system_clock::time_point SystemTime(Clock::time_point deadline) {
  return std::chrono::system_clock::now() +
         std::chrono::duration_cast<std::chrono::system_clock::duration>(deadline - Clock::now());
}

bool Contains(const std::string& text, const char* part) {
  return text.find(part) != std::string::npos;
}

// gRPC's account of a failed connection without its frame: "failed to
// connect to all addresses; last error: UNKNOWN: ipv4:127.0.0.1:1: Failed to
// connect to remote host: Connection refused" becomes the part after the
// address.
std::string LastError(const std::string& message) {
  std::string last = message;
  const std::size_t at = last.find("last error: ");
  if (at != std::string::npos) last.erase(0, at + 12);
  for (const char* scheme : {"ipv4:", "ipv6:", "unix:"}) {
    const std::size_t address = last.find(scheme);
    const std::size_t end =
        address == std::string::npos ? address : last.find(": ", address + std::strlen(scheme));
    if (end != std::string::npos) return last.substr(end + 2);
  }
  return last;
}

// Whether the status says the channel could not connect, so the request
// was never sent.
bool NotConnected(const std::string& message) {
  return Contains(message, "failed to connect to all addresses") ||
         Contains(message, "empty address list") || Contains(message, "DNS resolution failed");
}

grpc::ByteBuffer Serialized(const grpc::protobuf::MessageLite& message) {
  grpc::ByteBuffer buffer;
  bool own = false;
  grpc::SerializationTraits<grpc::protobuf::MessageLite>::Serialize(message, &buffer, &own);
  return buffer;
}

// One unary call by name through gRPC's generic stub, driven on a queue of
// its own as a blocking call is; the reply's bytes end up in one slice, as
// the reader's views need.
grpc::Status CallByName(EtcdMember& member, grpc::ClientContext* context, const char* method,
                        const grpc::ByteBuffer& request, grpc::Slice* reply) {
  grpc::CompletionQueue queue;
  grpc::ByteBuffer received;
  grpc::Status status;
  {
    auto call = member.calls.PrepareUnaryCall(context, method, request, &queue);
    call->StartCall();
    call->Finish(&received, &status, nullptr);
    void* tag = nullptr;
    bool ok = false;
    queue.Next(&tag, &ok);
  }
  queue.Shutdown();
  void* tag = nullptr;
  bool ok = false;
  while (queue.Next(&tag, &ok)) {
  }
  if (status.ok() && !received.TrySingleSlice(reply).ok() &&
      !received.DumpToSingleSlice(reply).ok()) {
    return grpc::Status(grpc::StatusCode::INTERNAL, "empty reply");
  }
  return status;
}

}  // namespace

EtcdClient::EtcdClient(const EtcdStoreOptions& options)
    : options_(options),
      material_(options.tls ? LoadTlsMaterial(options) : TlsMaterial()),
      members_(options, material_) {
  where_ = "etcd ";
  for (std::size_t i = 0; i < options.endpoints.size(); ++i) {
    where_ += (i ? "," : "") + options.endpoints[i];
  }
}

void EtcdClient::Fail(const grpc::Status& status, const char* what) const {
  throw ConfigStoreException(where_ + ": " + what + ": " + status.error_message(),
                             EtcdCode(status.error_code()));
}

EtcdClient::Call::Call(EtcdClient& client) : client_(client) {
  std::lock_guard<std::mutex> lock(client_.budgetMu_);
  if (client_.callDepth_++ > 0) return;
  client_.allowed_ = milliseconds(client_.options_.timeoutMs);
  client_.spent_ = Clock::duration::zero();
  client_.chargedUntil_ = Clock::time_point();
}

EtcdClient::Call::~Call() {
  std::lock_guard<std::mutex> lock(client_.budgetMu_);
  --client_.callDepth_;
}

void EtcdClient::AllowSettling() {
  const milliseconds extra = std::min(kSettling, milliseconds(options_.timeoutMs / 5));
  std::lock_guard<std::mutex> lock(budgetMu_);
  if (callDepth_ > 0) allowed_ = std::max(allowed_, spent_ + Clock::duration(extra));
}

Clock::time_point EtcdClient::Deadline() {
  const Clock::duration timeout = milliseconds(options_.timeoutMs);
  std::lock_guard<std::mutex> lock(budgetMu_);
  if (callDepth_ == 0) return Clock::now() + timeout;
  return Clock::now() + std::min(timeout, std::max(allowed_ - spent_, Clock::duration::zero()));
}

void EtcdClient::Charge(Clock::time_point start, Clock::time_point end) {
  std::lock_guard<std::mutex> lock(budgetMu_);
  if (callDepth_ == 0 || end <= chargedUntil_) return;
  spent_ += end - std::max(start, chargedUntil_);
  chargedUntil_ = end;
}

grpc::Status EtcdClient::Token(EtcdMember& member, Clock::time_point deadline, std::string* token) {
  if (options_.user.empty()) return grpc::Status::OK;
  std::lock_guard<std::mutex> lock(tokenMu_);
  if (!authenticated_) {
    etcdserverpb::AuthenticateRequest request;
    request.set_name(options_.user);
    request.set_password(options_.password);
    grpc::ClientContext context;
    context.set_deadline(SystemTime(deadline));
    context.set_wait_for_ready(false);
    grpc::Slice reply;
    grpc::Status status = CallByName(member, &context, "/etcdserverpb.Auth/Authenticate",
                                     Serialized(request), &reply);
    etcdserverpb::AuthenticateResponse response;
    if (status.ok() && !response.ParseFromArray(reply.begin(), static_cast<int>(reply.size()))) {
      status = grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply");
    }
    if (status.ok()) {
      token_ = response.token();
    } else if (!Contains(status.error_message(), "authentication is not enabled")) {
      // The member's own trouble is told apart from a refusal of the user.
      if (status.error_code() == grpc::StatusCode::UNAVAILABLE ||
          status.error_code() == grpc::StatusCode::DEADLINE_EXCEEDED) {
        return status;
      }
      return grpc::Status(status.error_code(), "authenticating as user " + options_.user + ": " +
                                                   status.error_message());
    }
    authenticated_ = true;
  }
  *token = token_;
  return grpc::Status::OK;
}

TlsFinding EtcdClient::Diagnose(std::size_t i, const std::string& lastError,
                                Clock::time_point deadline) {
  const std::string& endpoint = members_[i].endpoint;
  if (Contains(lastError, "Connection refused")) return {0, kRefused};
  if (Contains(lastError, "Peer name ")) {
    return {kErrorTlsName, "its certificate does not name " + HostOf(endpoint)};
  }
  const auto key = std::make_pair(i, lastError);
  {
    std::lock_guard<std::mutex> lock(findingsMu_);
    auto known = findings_.find(key);
    if (known != findings_.end()) return known->second;
  }
  const auto left = std::chrono::duration_cast<milliseconds>(deadline - Clock::now());
  TlsFinding finding = ProbeTls(endpoint, options_, material_, std::min(kProbeLimit, left));
  if (finding.code == 0 && options_.tls && Contains(lastError, "certificate verify failed")) {
    finding = {kErrorTlsUntrusted,
               "its certificate is not signed by " +
                   (options_.caFile.empty() ? std::string("a CA this host trusts (no cacert given)")
                                            : "the CA in " + options_.caFile)};
  }
  if (finding.code == 0) return {0, lastError};
  std::lock_guard<std::mutex> lock(findingsMu_);
  findings_[key] = finding;
  return finding;
}

EtcdClient::Outcome EtcdClient::Classify(std::size_t i, const grpc::Status& status,
                                         Clock::time_point deadline, TlsFinding* why) {
  const std::string& message = status.error_message();
  switch (status.error_code()) {
    case grpc::StatusCode::DEADLINE_EXCEEDED:
      why->text = members_[i].channel->GetState(false) == GRPC_CHANNEL_READY
                      ? "no answer"
                      : "not connected in time";
      return Outcome::kNoAnswer;
    case grpc::StatusCode::RESOURCE_EXHAUSTED:
      if (!Contains(message, "too many requests")) return Outcome::kAnswer;
      why->text = message;
      return Outcome::kBusy;
    case grpc::StatusCode::UNAVAILABLE:
      break;
    default:
      return Outcome::kAnswer;
  }
  if (!NotConnected(message)) {
    // etcd's answers during an election ("no leader", "leader changed",
    // "request timed out"), or a connection lost mid-request.
    why->text = message;
    return Outcome::kBusy;
  }
  const std::string lastError = LastError(message);
  // A connection that was accepted but not answered in time, during the
  // TLS handshake or before etcd's first HTTP/2 frame.
  if (Contains(lastError, "timed out") || Contains(lastError, "handshaker shutdown")) {
    why->text = "accepted the connection but did not answer";
    return Outcome::kNoAnswer;
  }
  *why = Diagnose(i, lastError, deadline);
  return Outcome::kUnreachable;
}

template <typename Send>
grpc::Status EtcdClient::Invoke(const char* what, const Send& send, std::size_t* answeredBy,
                                bool counted) {
  const Clock::time_point deadline =
      counted ? Deadline() : Clock::now() + milliseconds(options_.timeoutMs);
  const Clock::duration first =
      std::min<Clock::duration>(kFirstAttempt, milliseconds(std::max(1, options_.timeoutMs / 2)));
  // What each member did with the request, last time it was tried.
  std::vector<std::string> story(members_.Size());
  std::int32_t tlsCode = 0;
  bool reauthenticated = false;
  for (int round = 0;; ++round) {
    bool reached = false;  // a member took the request, or may take it soon
    bool stalled = false;
    for (const std::size_t i : members_.Order()) {
      const Clock::time_point start = Clock::now();
      if (start >= deadline) break;
      const Clock::time_point attemptEnd =
          members_.Size() == 1 ? deadline
                               : std::min(deadline, start + first * (1 << std::min(round, 4)));
      members_[i].Reconnect(attemptEnd);
      grpc::Status status;
      while (true) {
        grpc::ClientContext context;
        context.set_deadline(SystemTime(attemptEnd));
        // A refused connection fails the attempt at once, so the next member
        // is tried rather than this one waited for.
        context.set_wait_for_ready(false);
        std::string token;
        status = Token(members_[i], attemptEnd, &token);
        if (status.ok()) {
          if (!token.empty()) context.AddMetadata("token", token);
          status = send(members_[i], &context);
        }
        // Tokens expire when unused for a while (five minutes by default).
        if (status.error_code() != grpc::StatusCode::UNAUTHENTICATED || options_.user.empty() ||
            std::exchange(reauthenticated, true)) {
          break;
        }
        std::lock_guard<std::mutex> lock(tokenMu_);
        authenticated_ = false;
      }
      TlsFinding why;
      const Outcome outcome = Classify(i, status, attemptEnd, &why);
      if (outcome == Outcome::kAnswer) {
        members_.Answered(i);
        if (answeredBy) *answeredBy = i;
        return status;
      }
      if (counted) Charge(start, Clock::now());
      story[i] = why.text;
      if (outcome == Outcome::kUnreachable) {
        if (tlsCode == 0) tlsCode = why.code;
        continue;
      }
      reached = true;
      if (outcome == Outcome::kNoAnswer) {
        members_.Stalled(i);
        stalled = true;
      }
    }
    std::string told;
    for (std::size_t i = 0; i < story.size(); ++i) {
      if (!story[i].empty())
        told += (told.empty() ? "" : "; ") + members_[i].endpoint + ": " + story[i];
    }
    const Clock::time_point now = Clock::now();
    if (now >= deadline) {
      throw ConfigStoreException(
          where_ + ": " + what + ": no answer within " + std::to_string(options_.timeoutMs) +
              " ms" +
              (told.empty() ? " (this call has waited that long for members already)"
                            : " (" + told + ")"),
          EtcdCode(grpc::StatusCode::DEADLINE_EXCEEDED));
    }
    // gRPC may answer with how its last connection attempt ended while a new
    // one is under way: a member refused a moment ago that accepts a
    // connection now is back, and is given the next round.
    for (std::size_t i = 0; i < story.size() && !reached; ++i) {
      reached =
          story[i] == kRefused &&
          AcceptsConnections(
              members_[i].endpoint,
              std::min(kProbeLimit, std::chrono::duration_cast<milliseconds>(deadline - now)));
    }
    if (!reached) {
      throw ConfigStoreException(
          where_ + ": " + what + ": could not connect to any member: " + told,
          tlsCode != 0 ? tlsCode : EtcdCode(grpc::StatusCode::UNAVAILABLE));
    }
    if (!stalled) {
      std::this_thread::sleep_until(std::min(deadline, now + kBetweenRounds));
      if (counted) Charge(now, Clock::now());
    }
  }
}

grpc::Slice EtcdClient::Unary(const char* what, const char* method,
                              const grpc::protobuf::MessageLite& request) {
  const grpc::ByteBuffer sent = Serialized(request);
  grpc::Slice reply;
  const grpc::Status status = Invoke(what, [&](EtcdMember& member, grpc::ClientContext* context) {
    return CallByName(member, context, method, sent, &reply);
  });
  if (!status.ok()) Fail(status, what);
  return reply;
}

void EtcdClient::Range(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply) {
  reply->bytes = Unary("read", "/etcdserverpb.KV/Range", request);
  if (!etcdwire::ParseRangeResponse(reply)) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "read");
  }
}

void EtcdClient::Txn(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply) {
  const bool writes = std::any_of(request.success().begin(), request.success().end(),
                                  [](const auto& op) { return !op.has_request_range(); });
  const char* what = writes ? "write" : "read";
  reply->bytes = Unary(what, "/etcdserverpb.KV/Txn", request);
  if (!etcdwire::ParseTxnResponse(reply) ||
      reply->ranges.size() != static_cast<std::size_t>(reply->succeeded ? request.success_size()
                                                                        : request.failure_size())) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), what);
  }
}

bool EtcdClient::Txn(const etcdserverpb::TxnRequest& request) {
  etcdwire::Reply reply;
  Txn(request, &reply);
  return reply.succeeded;
}

std::int64_t EtcdClient::LeaseGrant(std::int64_t ttlSeconds) {
  etcdserverpb::LeaseGrantRequest request;
  request.set_ttl(ttlSeconds);
  const grpc::Slice reply = Unary("lease grant", "/etcdserverpb.Lease/LeaseGrant", request);
  etcdserverpb::LeaseGrantResponse response;
  if (!response.ParseFromArray(reply.begin(), static_cast<int>(reply.size()))) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "lease grant");
  }
  return response.id();
}

void EtcdClient::LeaseKeepAlive(std::int64_t lease) {
  const grpc::Status status =
      Invoke("lease keep-alive", [&](EtcdMember& member, grpc::ClientContext* context) {
        auto stream = member.lease->LeaseKeepAlive(context);
        etcdserverpb::LeaseKeepAliveRequest request;
        request.set_id(lease);
        etcdserverpb::LeaseKeepAliveResponse response;
        if (stream->Write(request)) stream->Read(&response);
        stream->WritesDone();
        grpc::Status finished = stream->Finish();
        if (finished.ok() && response.ttl() <= 0) {
          return grpc::Status(grpc::StatusCode::NOT_FOUND, "the writer's lease has expired");
        }
        return finished;
      });
  if (!status.ok()) Fail(status, "lease keep-alive");
}

void EtcdClient::LeaseRevoke(std::int64_t lease) {
  etcdserverpb::LeaseRevokeRequest request;
  request.set_id(lease);
  try {
    Unary("lease revoke", "/etcdserverpb.Lease/LeaseRevoke", request);
  } catch (const ConfigStoreException& e) {
    // A lease that is gone already (run out, or revoked by an earlier attempt
    // whose answer was lost) is what was asked for.
    if (e.Code() != EtcdCode(grpc::StatusCode::NOT_FOUND)) throw;
  }
}

std::unique_ptr<EtcdClient::WatchStream> EtcdClient::Watch(const std::string& key,
                                                           grpc::ClientContext* context,
                                                           std::size_t* member) {
  etcdserverpb::RangeRequest request;
  request.set_key(key);
  request.set_limit(1);
  request.set_keys_only(true);
  // Any answer will do, a refusal too: the watch then reports it.
  const grpc::ByteBuffer sent = Serialized(request);
  Invoke(
      "watch",
      [&](EtcdMember& m, grpc::ClientContext* c) {
        grpc::Slice ignored;
        return CallByName(m, c, "/etcdserverpb.KV/Range", sent, &ignored);
      },
      member, false);
  context->set_wait_for_ready(false);
  {
    std::lock_guard<std::mutex> lock(tokenMu_);
    if (!token_.empty()) context->AddMetadata("token", token_);
  }
  return members_[*member].watch->Watch(context);
}

}  // namespace TavoConfigStore
