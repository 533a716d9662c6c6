#include "EtcdWatch.h"

#include <chrono>

#include "EtcdLayout.h"

namespace TavoConfigStore {

ChangeFeed::ChangeFeed(EtcdClient& client, std::string prefix, std::int64_t startRevision)
    : client_(client), prefix_(std::move(prefix)), next_(startRevision) {
  thread_ = std::thread([this] { Run(); });
}

ChangeFeed::~ChangeFeed() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
    if (context_) context_->TryCancel();
  }
  changed_.notify_all();
  thread_.join();
}

bool ChangeFeed::Wait(int timeoutMs) {
  std::unique_lock<std::mutex> lock(mu_);
  changed_.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return seen_; });
  return std::exchange(seen_, false);
}

void ChangeFeed::Run() {
  while (true) {
    auto context = std::make_shared<grpc::ClientContext>();
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (stopping_) return;
      context_ = context;
    }
    Follow(context.get());
    std::unique_lock<std::mutex> lock(mu_);
    context_.reset();
    if (stopping_) return;
    // A lost stream may have missed a change: say so.
    seen_ = true;
    changed_.notify_all();
    changed_.wait_for(lock, std::chrono::milliseconds(500), [this] { return stopping_; });
  }
}

// Reads the watch's events until the stream ends.
void ChangeFeed::Follow(grpc::ClientContext* context) {
  std::size_t member = 0;
  std::unique_ptr<EtcdClient::WatchStream> stream;
  try {
    stream = client_.Watch(prefix_, context, &member);
  } catch (const ConfigStoreException&) {
    // Credentials refused or cluster away: the wait says "look again", and
    // the caller's read reports the failure.
    return;
  }
  etcdserverpb::WatchRequest request;
  auto* create = request.mutable_create_request();
  create->set_key(prefix_);
  create->set_range_end(etcdlayout::PrefixEnd(prefix_));
  create->set_start_revision(next_);
  etcdserverpb::WatchResponse response;
  if (stream->Write(request)) {
    while (stream->Read(&response)) {
      if (response.compact_revision() > 0) next_ = response.compact_revision();
      if (response.events_size() > 0) {
        next_ = response.events(response.events_size() - 1).kv().mod_revision() + 1;
      }
      if (response.events_size() > 0 || response.compact_revision() > 0) Signal();
      if (response.canceled()) break;
    }
  }
  context->TryCancel();
  // A stream that broke sends the next watch to another member.
  if (stream->Finish().error_code() != grpc::StatusCode::CANCELLED) client_.StreamLost(member);
}

void ChangeFeed::Signal() {
  std::lock_guard<std::mutex> lock(mu_);
  seen_ = true;
  changed_.notify_all();
}

}  // namespace TavoConfigStore
