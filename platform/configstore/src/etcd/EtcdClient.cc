#include "EtcdClient.h"

#include <netdb.h>
#include <sys/socket.h>

#include <algorithm>
#include <fstream>
#include <sstream>
#include <thread>
#include <vector>

namespace TavoConfigStore {
namespace {

std::string ReadPem(const std::string& path, const char* what) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  if (!in || text.str().empty()) {
    throw ConfigStoreException("etcd: cannot read the " + std::string(what) + " file " + path,
                               kErrorBadLocator);
  }
  return text.str();
}

std::string HostOf(const std::string& endpoint) {
  std::string host = endpoint.substr(0, endpoint.rfind(':'));
  if (host.size() > 1 && host.front() == '[') host = host.substr(1, host.size() - 2);
  return host;
}

// gRPC takes one name, or a list of addresses: several members are resolved
// here so that the channel can move from one to the next.
std::string Target(const std::vector<std::string>& endpoints) {
  if (endpoints.size() == 1) return "dns:///" + endpoints[0];
  std::string v4;
  std::string v6;
  for (const std::string& endpoint : endpoints) {
    const std::string port = endpoint.substr(endpoint.rfind(':') + 1);
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* found = nullptr;
    if (getaddrinfo(HostOf(endpoint).c_str(), port.c_str(), &hints, &found) != 0) {
      throw ConfigStoreException("etcd: cannot resolve the endpoint " + endpoint,
                                 kErrorEtcdBase + static_cast<int>(grpc::StatusCode::UNAVAILABLE));
    }
    for (addrinfo* a = found; a != nullptr; a = a->ai_next) {
      char host[NI_MAXHOST];
      if (getnameinfo(a->ai_addr, a->ai_addrlen, host, sizeof host, nullptr, 0, NI_NUMERICHOST) !=
          0) {
        continue;
      }
      if (a->ai_family == AF_INET) v4 += (v4.empty() ? "" : ",") + std::string(host) + ":" + port;
      if (a->ai_family == AF_INET6) {
        v6 += (v6.empty() ? "" : ",") + std::string("[") + host + "]:" + port;
      }
    }
    freeaddrinfo(found);
  }
  return v4.empty() ? "ipv6:" + v6 : "ipv4:" + v4;
}

bool RetriesOn(const grpc::Status& status) {
  return status.error_code() == grpc::StatusCode::UNAVAILABLE;
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

EtcdClient::EtcdClient(const EtcdStoreOptions& options) : options_(options) {
  where_ = "etcd ";
  for (std::size_t i = 0; i < options.endpoints.size(); ++i) {
    where_ += (i ? "," : "") + options.endpoints[i];
  }
  std::shared_ptr<grpc::ChannelCredentials> credentials = grpc::InsecureChannelCredentials();
  grpc::ChannelArguments arguments;
  arguments.SetMaxReceiveMessageSize(-1);
  arguments.SetMaxSendMessageSize(-1);
  arguments.SetLoadBalancingPolicyName("pick_first");
  if (options.tls) {
    grpc::SslCredentialsOptions ssl;
    if (!options.caFile.empty()) ssl.pem_root_certs = ReadPem(options.caFile, "CA certificate");
    if (!options.certFile.empty()) {
      ssl.pem_cert_chain = ReadPem(options.certFile, "client certificate");
      ssl.pem_private_key = ReadPem(options.keyFile, "client key");
    }
    credentials = grpc::SslCredentials(ssl);
    // The certificate must name the host the locator names, whatever address
    // the connection ends up on.
    arguments.SetSslTargetNameOverride(HostOf(options.endpoints.at(0)));
  }
  channel_ = grpc::CreateCustomChannel(Target(options.endpoints), credentials, arguments);
  kv_ = etcdserverpb::KV::NewStub(channel_);
  rangeMethod_ = std::make_unique<grpc::internal::RpcMethod>(
      "/etcdserverpb.KV/Range", grpc::internal::RpcMethod::NORMAL_RPC, channel_);
  txnMethod_ = std::make_unique<grpc::internal::RpcMethod>(
      "/etcdserverpb.KV/Txn", grpc::internal::RpcMethod::NORMAL_RPC, channel_);
  lease_ = etcdserverpb::Lease::NewStub(channel_);
  watch_ = etcdserverpb::Watch::NewStub(channel_);
  auth_ = etcdserverpb::Auth::NewStub(channel_);
}

void EtcdClient::Fail(const grpc::Status& status, const char* what) const {
  std::string message = where_ + ": " + what + ": ";
  if (status.error_code() != grpc::StatusCode::DEADLINE_EXCEEDED) {
    message += status.error_message();
  } else if (channel_->GetState(false) == GRPC_CHANNEL_TRANSIENT_FAILURE) {
    message += "could not connect to any member within " + std::to_string(options_.timeoutMs) +
               " ms (refused, unreachable, or the TLS handshake failed)";
  } else {
    message += "no answer within " + std::to_string(options_.timeoutMs) + " ms";
  }
  throw ConfigStoreException(message, kErrorEtcdBase + static_cast<int>(status.error_code()));
}

void EtcdClient::Prepare(grpc::ClientContext* context) {
  // Wait for a member to answer until the deadline instead of failing at
  // the first refused connection.
  context->set_wait_for_ready(true);
  if (!options_.user.empty()) {
    Authenticate(std::min(context->deadline(), std::chrono::system_clock::now() +
                                                   std::chrono::milliseconds(options_.timeoutMs)));
    std::lock_guard<std::mutex> lock(tokenMu_);
    if (!token_.empty()) context->AddMetadata("token", token_);
  }
}

void EtcdClient::Authenticate(std::chrono::system_clock::time_point deadline) {
  std::lock_guard<std::mutex> lock(tokenMu_);
  if (authenticated_) return;
  etcdserverpb::AuthenticateRequest request;
  request.set_name(options_.user);
  request.set_password(options_.password);
  etcdserverpb::AuthenticateResponse response;
  grpc::ClientContext context;
  context.set_deadline(deadline);
  context.set_wait_for_ready(true);
  const grpc::Status status = auth_->Authenticate(&context, request, &response);
  if (status.ok()) {
    token_ = response.token();
  } else if (status.error_message().find("authentication is not enabled") == std::string::npos) {
    Fail(status, ("authenticating as user " + options_.user).c_str());
  }
  authenticated_ = true;
}

template <typename Call>
grpc::Status EtcdClient::Invoke(const Call& call, bool retry) {
  // One deadline for every attempt: a request ends within the timeout
  // however often a member drops it.
  const auto deadline =
      std::chrono::system_clock::now() + std::chrono::milliseconds(options_.timeoutMs);
  bool reauthenticated = false;
  while (true) {
    grpc::ClientContext context;
    context.set_deadline(deadline);
    Prepare(&context);
    grpc::Status status = call(&context);
    if (status.ok()) return status;
    // Tokens expire when unused for a while (five minutes by default).
    if (status.error_code() == grpc::StatusCode::UNAUTHENTICATED && !options_.user.empty() &&
        !reauthenticated) {
      reauthenticated = true;
      std::lock_guard<std::mutex> lock(tokenMu_);
      authenticated_ = false;
      token_.clear();
      continue;
    }
    if (!retry || !RetriesOn(status) || std::chrono::system_clock::now() >= deadline) {
      return status;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
}

etcdserverpb::TxnResponse EtcdClient::Txn(const etcdserverpb::TxnRequest& request, bool retry) {
  etcdserverpb::TxnResponse response;
  const grpc::Status status = Invoke(
      [&](grpc::ClientContext* context) { return kv_->Txn(context, request, &response); }, retry);
  if (!status.ok()) Fail(status, "write");  // reads go through Read
  return response;
}

template <typename Request>
void EtcdClient::Receive(const grpc::internal::RpcMethod& method, const Request& request,
                         etcdwire::Reply* reply) {
  grpc::ByteBuffer received;
  const grpc::Status status = Invoke(
      [&](grpc::ClientContext* context) {
        return grpc::internal::BlockingUnaryCall<Request, grpc::ByteBuffer,
                                                 grpc::protobuf::MessageLite, grpc::ByteBuffer>(
            channel_.get(), method, context, request, &received);
      },
      true);
  if (!status.ok()) Fail(status, "read");
  // A large reply arrives in several slices; the views need one.
  if (!received.TrySingleSlice(&reply->bytes).ok() &&
      !received.DumpToSingleSlice(&reply->bytes).ok()) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "empty reply"), "read");
  }
}

void EtcdClient::Read(const etcdserverpb::RangeRequest& request, etcdwire::Reply* reply) {
  Receive(*rangeMethod_, request, reply);
  if (!etcdwire::ParseRangeResponse(reply)) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "read");
  }
}

void EtcdClient::Read(const etcdserverpb::TxnRequest& request, etcdwire::Reply* reply) {
  Receive(*txnMethod_, request, reply);
  if (!etcdwire::ParseTxnResponse(reply)) {
    Fail(grpc::Status(grpc::StatusCode::INTERNAL, "unreadable reply"), "read");
  }
}

std::int64_t EtcdClient::LeaseGrant(std::int64_t ttlSeconds) {
  etcdserverpb::LeaseGrantRequest request;
  request.set_ttl(ttlSeconds);
  etcdserverpb::LeaseGrantResponse response;
  const grpc::Status status = Invoke(
      [&](grpc::ClientContext* context) { return lease_->LeaseGrant(context, request, &response); },
      true);
  if (!status.ok()) Fail(status, "lease grant");
  return response.id();
}

void EtcdClient::LeaseKeepAlive(std::int64_t lease) {
  const grpc::Status status = Invoke(
      [&](grpc::ClientContext* context) {
        auto stream = lease_->LeaseKeepAlive(context);
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
      },
      true);
  if (!status.ok()) Fail(status, "lease keep-alive");
}

void EtcdClient::LeaseRevoke(std::int64_t lease) {
  etcdserverpb::LeaseRevokeRequest request;
  request.set_id(lease);
  etcdserverpb::LeaseRevokeResponse response;
  const grpc::Status status = Invoke(
      [&](grpc::ClientContext* context) {
        return lease_->LeaseRevoke(context, request, &response);
      },
      true);
  // A lease that is gone already (run out, or revoked by an earlier attempt
  // whose answer was lost) is what was asked for.
  if (!status.ok() && status.error_code() != grpc::StatusCode::NOT_FOUND) {
    Fail(status, "lease revoke");
  }
}

}  // namespace TavoConfigStore
