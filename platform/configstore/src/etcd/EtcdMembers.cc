#include "EtcdMembers.h"

#include <algorithm>
#include <tuple>

#include "EtcdTlsProbe.h"

namespace TavoConfigStore {
namespace {

// A member that went away is connected to again within a second of coming
// back; connecting (the TLS handshake and etcd's first HTTP/2 frame
// included) gives up after a second, so a member that accepts and never
// answers counts as not answering rather than holding requests.
constexpr int kInitialReconnectMs = 100;
constexpr int kMaxReconnectMs = 1000;
constexpr int kConnectTimeoutMs = 1000;
// How long a connection tried again has to show its outcome before a
// request is sent: a refusal from a member on the network comes back well
// within it.
constexpr std::chrono::steady_clock::duration kConnectOutcomeWait = std::chrono::milliseconds(50);
// A stream held on a member that stops answering (a watch) breaks within
// about 15 s. etcd refuses pings more often than every 5 s.
constexpr int kKeepaliveMs = 10000;
constexpr int kKeepaliveTimeoutMs = 5000;

std::shared_ptr<grpc::Channel> ChannelTo(const std::string& endpoint,
                                         const EtcdStoreOptions& options,
                                         const TlsMaterial& material) {
  grpc::ChannelArguments arguments;
  arguments.SetMaxReceiveMessageSize(-1);
  arguments.SetMaxSendMessageSize(-1);
  arguments.SetInt(GRPC_ARG_INITIAL_RECONNECT_BACKOFF_MS, kInitialReconnectMs);
  arguments.SetInt(GRPC_ARG_MAX_RECONNECT_BACKOFF_MS, kMaxReconnectMs);
  arguments.SetInt(GRPC_ARG_MIN_RECONNECT_BACKOFF_MS, kConnectTimeoutMs);
  arguments.SetInt(GRPC_ARG_KEEPALIVE_TIME_MS, kKeepaliveMs);
  arguments.SetInt(GRPC_ARG_KEEPALIVE_TIMEOUT_MS, kKeepaliveTimeoutMs);
  arguments.SetInt(GRPC_ARG_HTTP2_MAX_PINGS_WITHOUT_DATA, 0);
  std::shared_ptr<grpc::ChannelCredentials> credentials = grpc::InsecureChannelCredentials();
  if (options.tls) {
    grpc::SslCredentialsOptions ssl;
    ssl.pem_root_certs = material.ca;
    ssl.pem_cert_chain = material.cert;
    ssl.pem_private_key = material.key;
    credentials = grpc::SslCredentials(ssl);
    // The certificate must name the host the locator names, whatever
    // address the name resolves to.
    arguments.SetSslTargetNameOverride(HostOf(endpoint));
  }
  return grpc::CreateCustomChannel("dns:///" + endpoint, credentials, arguments);
}

}  // namespace

EtcdMember::EtcdMember(const std::string& endpoint, const EtcdStoreOptions& options,
                       const TlsMaterial& material)
    : endpoint(endpoint),
      channel(ChannelTo(endpoint, options, material)),
      calls(channel),
      lease(etcdserverpb::Lease::NewStub(channel)),
      watch(etcdserverpb::Watch::NewStub(channel)) {}

void EtcdMember::Reconnect(std::chrono::steady_clock::time_point until) {
  if (channel->GetState(false) != GRPC_CHANNEL_TRANSIENT_FAILURE) return;
  grpc::experimental::ChannelResetConnectionBackoff(channel.get());
  // The new attempt's outcome is only seen while some thread waits on gRPC:
  // without this wait, a refusal would go unseen and the attempt end at its
  // timeout, as if the member had accepted the connection and said nothing.
  // A member that is back returns the wait early, ready.
  const auto wait = std::min(until - std::chrono::steady_clock::now(), kConnectOutcomeWait);
  channel->WaitForStateChange(GRPC_CHANNEL_TRANSIENT_FAILURE,
                              std::chrono::system_clock::now() + wait);
}

EtcdMembers::EtcdMembers(const EtcdStoreOptions& options, const TlsMaterial& material)
    : stalled_(options.endpoints.size(), false) {
  for (const std::string& endpoint : options.endpoints) {
    members_.push_back(std::make_unique<EtcdMember>(endpoint, options, material));
  }
}

std::vector<std::size_t> EtcdMembers::Order() const {
  std::lock_guard<std::mutex> lock(mu_);
  std::vector<std::size_t> order(members_.size());
  for (std::size_t i = 0; i < order.size(); ++i) order[i] = i;
  const auto rank = [&](std::size_t i) { return std::make_tuple(stalled_[i], i != preferred_, i); };
  std::sort(order.begin(), order.end(),
            [&](std::size_t a, std::size_t b) { return rank(a) < rank(b); });
  return order;
}

void EtcdMembers::Answered(std::size_t i) {
  std::lock_guard<std::mutex> lock(mu_);
  preferred_ = i;
  stalled_[i] = false;
}

void EtcdMembers::Stalled(std::size_t i) {
  std::lock_guard<std::mutex> lock(mu_);
  stalled_[i] = true;
}

}  // namespace TavoConfigStore
