#include "EtcdTxn.h"

#include <algorithm>
#include <utility>

namespace TavoConfigStore {

using etcdserverpb::Compare;
using etcdserverpb::TxnRequest;

void AddPut(TxnRequest* txn, std::string key, std::string value, std::int64_t lease) {
  auto* put = txn->add_success()->mutable_request_put();
  put->set_key(std::move(key));
  put->set_value(std::move(value));
  put->set_lease(lease);
}

void AddDelete(TxnRequest* txn, std::string key, std::string rangeEnd) {
  auto* del = txn->add_success()->mutable_request_delete_range();
  del->set_key(std::move(key));
  del->set_range_end(std::move(rangeEnd));
}

void AddDeletePrefix(TxnRequest* txn, const std::string& prefix) {
  AddDelete(txn, prefix, etcdlayout::PrefixEnd(prefix));
}

void AddCompareRevision(TxnRequest* txn, const std::string& key, std::int64_t revision) {
  Compare* compare = txn->add_compare();
  compare->set_key(key);
  compare->set_result(Compare::EQUAL);
  // An absent key has version 0; a present one never has mod revision 0.
  compare->set_target(revision != 0 ? Compare::MOD : Compare::VERSION);
  if (revision != 0) compare->set_mod_revision(revision);
}

Batches::~Batches() {
  for (std::future<void>& batch : inFlight_) batch.wait();
}

void Batches::Put(std::string key, std::string value, std::size_t size, std::int64_t lease) {
  if (bytes_ + size > etcdlayout::kBatchBytes) Send();
  AddPut(&txn_, std::move(key), std::move(value), lease);
  Added(size);
}

void Batches::Delete(std::string key, std::string rangeEnd) {
  AddDelete(&txn_, std::move(key), std::move(rangeEnd));
  Added(0);
}

void Batches::Finish() {
  Send();
  while (!inFlight_.empty()) Collect();
}

void Batches::Added(std::size_t size) {
  bytes_ += size;
  if (static_cast<std::size_t>(txn_.success_size()) >= etcdlayout::kBatchOps ||
      bytes_ >= etcdlayout::kBatchBytes) {
    Send();
  }
}

void Batches::Send() {
  if (txn_.success_size() == 0) return;
  TxnRequest txn = std::exchange(txn_, TxnRequest());
  bytes_ = 0;
  if (!started_) {
    started_ = true;
    client_.Txn(txn);
    return;
  }
  if (inFlight_.size() >= kInFlight) Collect();
  inFlight_.push_back(
      std::async(std::launch::async, [this, txn = std::move(txn)] { client_.Txn(txn); }));
}

void Batches::Collect() {
  std::future<void> oldest = std::move(inFlight_.front());
  inFlight_.pop_front();
  oldest.get();
}

void WriteObject(const etcdlayout::Keys& keys, const std::string& gen, const std::string& instance,
                 etcdlayout::Header header, std::string_view body, Batches* batches) {
  const std::string object = keys.Object(gen, instance);
  header.parts =
      std::max<std::size_t>(1, (body.size() + etcdlayout::kPartBytes - 1) / etcdlayout::kPartBytes);
  for (std::size_t part = 0; part < header.parts; ++part) {
    const std::string_view piece =
        body.substr(part * etcdlayout::kPartBytes, etcdlayout::kPartBytes);
    batches->Put(object + etcdlayout::Keys::PartSuffix(part),
                 part == 0 ? etcdlayout::FirstPart(header, piece) : std::string(piece),
                 piece.size() + object.size() + 32);
  }
}

void DeleteGenerations(EtcdClient& client, const etcdlayout::Keys& keys,
                       const std::vector<std::string>& gens) {
  Batches batches(client);
  for (const std::string& gen : gens) {
    batches.Delete(keys.Generation(gen), etcdlayout::PrefixEnd(keys.Generation(gen)));
    batches.Delete(keys.Registered() + gen);
  }
  batches.Finish();
}

}  // namespace TavoConfigStore
