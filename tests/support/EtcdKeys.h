// etcd's keys as the cluster holds them, for the tests that look under the
// store: what a dead writer or an earlier version left, and which keys a
// store has.

#ifndef KARST_TESTS_SUPPORT_ETCD_KEYS_H_
#define KARST_TESTS_SUPPORT_ETCD_KEYS_H_

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace karst_test {

// Talks plain gRPC to one member of a cluster without TLS or users; throws
// std::runtime_error when a call fails.
class EtcdKeys {
 public:
  explicit EtcdKeys(const std::string& endpoint);
  ~EtcdKeys();

  // Every key starting with "prefix", with its value.
  std::map<std::string, std::string> List(const std::string& prefix) const;
  // Every key starting with "prefix", without the values.
  std::vector<std::string> Keys(const std::string& prefix) const;
  void Put(const std::string& key, const std::string& value, std::int64_t lease = 0) const;
  std::int64_t GrantLease(std::int64_t ttlSeconds) const;
  void RevokeLease(std::int64_t lease) const;

 private:
  struct Stubs;
  std::unique_ptr<Stubs> stubs_;
};

// The root of the store at "prefix": "/<prefix>/" and a zero byte, with each
// \0 of the prefix written \1\1 and each \1 \1\2.
std::string StoreRoot(const std::string& prefix);

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_ETCD_KEYS_H_
