#include "EtcdClient.h"

#include <grpcpp/impl/client_unary_call.h>

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
// A handshake of the client's own, to tell why TLS failed.
constexpr milliseconds kProbeLimit{1000};
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

}  // namespace

std::string PrefixEnd(std::string prefix) {
  while (!prefix.empty()) {
    if (static_cast<unsigned char>(prefix.back()) != 0xff) {
      prefix.back() = static_cast<char>(static_cast<unsigned char>(prefix.back()) + 1);
      return prefix;
    }
    prefix.pop_back();
  }
  return std::string(1, '\0');  // every key
}

EtcdClient::EtcdClient(const EtcdStoreOptions& options)
    : options_(options),
      material_(options.tls ? LoadTlsMaterial(options) : TlsMaterial()),
      members_(options, material_),
      budget_(milliseconds(options.timeoutMs)) {
  where_ = "etcd ";
  for (std::size_t i = 0; i < options.endpoints.size(); ++i) {
    where_ += (i ? "," : "") + options.endpoints[i];
  }
}

void EtcdClient::Fail(const grpc::Status& status, const char* what) const {
  throw ConfigStoreException(where_ + ": " + what + ": " + status.error_message(),
                             kErrorEtcdBase + static_cast<int>(status.error_code()));
}

void EtcdClient::AllowSettling() {
  budget_.Extend(std::min(kSettling, milliseconds(options_.timeoutMs / 5)));
}

grpc::Status EtcdClient::Token(EtcdMember& member, Clock::time_point deadline, std::string* token) {
  if (options_.user.empty()) return grpc::Status::OK;
  std::lock_guard<std::mutex> lock(tokenMu_);
  if (!authenticated_) {
    etcdserverpb::AuthenticateRequest request;
    request.set_name(options_.user);
    request.set_password(options_.password);
    etcdserverpb::AuthenticateResponse response;
    grpc::ClientContext context;
    context.set_deadline(SystemTime(deadline));
    context.set_wait_for_ready(false);
    grpc::Status status = member.auth->Authenticate(&context, request, &response);
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

void EtcdClient::ForgetToken() {
  std::lock_guard<std::mutex> lock(tokenMu_);
  authenticated_ = false;
  token_.clear();
}

TlsFinding EtcdClient::Diagnose(std::size_t i, const std::string& lastError,
                                Clock::time_point deadline) {
  const std::string& endpoint = members_[i].endpoint;
  if (Contains(lastError, "Connection refused")) return {0, "connection refused"};
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
grpc::Status EtcdClient::Invoke(const char* what, bool retry, const Send& send,
                                std::size_t* answeredBy, bool counted) {
  const Clock::time_point deadline =
      counted ? budget_.Deadline(Clock::now()) : Clock::now() + milliseconds(options_.timeoutMs);
  const Clock::duration first =
      std::min<Clock::duration>(kFirstAttempt, milliseconds(std::max(1, options_.timeoutMs / 2)));
  // What each member did with the request, last time it was tried.
  std::vector<std::string> story(members_.Size());
  std::int32_t tlsCode = 0;
  bool reauthenticated = false;
  auto told = [&] {
    std::string text;
    for (std::size_t i = 0; i < story.size(); ++i) {
      if (story[i].empty()) continue;
      text += (text.empty() ? "" : "; ") + members_[i].endpoint + ": " + story[i];
    }
    return text;
  };
  for (int round = 0;; ++round) {
    bool reached = false;  // a member took the request, or may take it soon
    bool stalled = false;
    for (const std::size_t i : members_.Order()) {
      const Clock::time_point start = Clock::now();
      if (start >= deadline) break;
      const Clock::time_point attemptEnd =
          !retry || members_.Size() == 1
              ? deadline
              : std::min(deadline, start + first * (1 << std::min(round, 4)));
      EtcdMember& member = members_[i];
      grpc::Status status;
      while (true) {
        grpc::ClientContext context;
        context.set_deadline(SystemTime(attemptEnd));
        // A refused connection fails the attempt at once, so the next member
        // is tried rather than this one waited for.
        context.set_wait_for_ready(false);
        std::string token;
        status = Token(member, attemptEnd, &token);
        if (status.ok()) {
          if (!token.empty()) context.AddMetadata("token", token);
          status = send(member, &context);
        }
        // Tokens expire when unused for a while (five minutes by default).
        if (status.error_code() != grpc::StatusCode::UNAUTHENTICATED || options_.user.empty() ||
            reauthenticated) {
          break;
        }
        reauthenticated = true;
        ForgetToken();
      }
      TlsFinding why;
      const Outcome outcome = Classify(i, status, attemptEnd, &why);
      if (outcome == Outcome::kAnswer) {
        members_.Answered(i);
        if (answeredBy) *answeredBy = i;
        return status;
      }
      if (counted) budget_.Charge(start, Clock::now());
      story[i] = why.text;
      if (outcome == Outcome::kUnreachable) {
        if (tlsCode == 0) tlsCode = why.code;
        continue;
      }
      reached = true;
      if (outcome == Outcome::kNoAnswer) {
        members_.Stalled(i);
        stalled = true;
      } else if (!retry) {
        return status;  // it may have been applied: not sent again
      }
    }
    const Clock::time_point now = Clock::now();
    if (now >= deadline) {
      const std::string text = told();
      throw ConfigStoreException(
          where_ + ": " + what + ": no answer within " + std::to_string(options_.timeoutMs) +
              " ms" +
              (text.empty() ? " (this call has waited that long for members already)"
                            : " (" + text + ")"),
          kErrorEtcdBase + static_cast<int>(grpc::StatusCode::DEADLINE_EXCEEDED));
    }
    if (!reached) {
      throw ConfigStoreException(
          where_ + ": " + what + ": could not connect to any member: " + told(),
          tlsCode != 0 ? tlsCode
                       : kErrorEtcdBase + static_cast<int>(grpc::StatusCode::UNAVAILABLE));
    }
    if (!stalled) {
      std::this_thread::sleep_until(std::min(deadline, now + kBetweenRounds));
      if (counted) budget_.Charge(now, Clock::now());
    }
  }
}

etcdserverpb::TxnResponse EtcdClient::Txn(const etcdserverpb::TxnRequest& request, bool retry) {
  etcdserverpb::TxnResponse response;
  const grpc::Status status =
      Invoke("write", retry, [&](EtcdMember& member, grpc::ClientContext* context) {
        return member.kv->Txn(context, request, &response);
      });
  if (!status.ok()) Fail(status, "write");  // reads go through Read
  return response;
}

template <typename Request>
void EtcdClient::Receive(grpc::internal::RpcMethod EtcdMember::*method, const Request& request,
                         etcdwire::Reply* reply) {
  grpc::ByteBuffer received;
  const grpc::Status status =
      Invoke("read", true, [&](EtcdMember& member, grpc::ClientContext* context) {
        return grpc::internal::BlockingUnaryCall<Request, grpc::ByteBuffer,
                                                 grpc::protobuf::MessageLite, grpc::ByteBuffer>(
            member.channel.get(), member.*method, context, request, &received);
      });
  if (!status.ok()) Fail(status, "read");
  // A large reply arrives in several slices; the views need one.
  if (!received.TrySingleSlice(&reply->bytes).ok() &&
      !received.DumpToSingleSlice(&reply->bytes).ok()) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "empty reply"), "read");
  }
}

void EtcdClient::Read(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply) {
  Receive(&EtcdMember::range, request, reply);
  if (!etcdwire::ParseRangeResponse(reply)) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "read");
  }
}

void EtcdClient::Read(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply) {
  Receive(&EtcdMember::txn, request, reply);
  if (!etcdwire::ParseTxnResponse(reply)) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "read");
  }
}

std::int64_t EtcdClient::LeaseGrant(std::int64_t ttlSeconds) {
  etcdserverpb::LeaseGrantRequest request;
  request.set_ttl(ttlSeconds);
  etcdserverpb::LeaseGrantResponse response;
  const grpc::Status status =
      Invoke("lease grant", true, [&](EtcdMember& member, grpc::ClientContext* context) {
        return member.lease->LeaseGrant(context, request, &response);
      });
  if (!status.ok()) Fail(status, "lease grant");
  return response.id();
}

void EtcdClient::LeaseKeepAlive(std::int64_t lease) {
  const grpc::Status status =
      Invoke("lease keep-alive", true, [&](EtcdMember& member, grpc::ClientContext* context) {
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
  etcdserverpb::LeaseRevokeResponse response;
  const grpc::Status status =
      Invoke("lease revoke", true, [&](EtcdMember& member, grpc::ClientContext* context) {
        return member.lease->LeaseRevoke(context, request, &response);
      });
  // A lease that is gone already (run out, or revoked by an earlier attempt
  // whose answer was lost) is what was asked for.
  if (!status.ok() && status.error_code() != grpc::StatusCode::NOT_FOUND) {
    Fail(status, "lease revoke");
  }
}

etcdserverpb::Watch::Stub& EtcdClient::WatchStub(const std::string& key,
                                                 grpc::ClientContext* context,
                                                 std::size_t* member) {
  etcdserverpb::RangeRequest request;
  request.set_key(key);
  request.set_limit(1);
  request.set_keys_only(true);
  // Any answer will do, a refusal too: the watch then reports it.
  Invoke(
      "watch", true,
      [&](EtcdMember& m, grpc::ClientContext* c) {
        grpc::ByteBuffer received;
        return grpc::internal::BlockingUnaryCall<etcdserverpb::RangeRequest, grpc::ByteBuffer,
                                                 grpc::protobuf::MessageLite, grpc::ByteBuffer>(
            m.channel.get(), m.range, c, request, &received);
      },
      member, false);
  context->set_wait_for_ready(false);
  std::lock_guard<std::mutex> lock(tokenMu_);
  if (!token_.empty()) context->AddMetadata("token", token_);
  return *members_[*member].watch;
}

}  // namespace TavoConfigStore
