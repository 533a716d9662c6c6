// Real etcd clusters for the tests: members on loopback ports of their own,
// with TLS and user/password authentication when asked for.

#ifndef KARST_TESTS_SUPPORT_ETCD_CLUSTER_H_
#define KARST_TESTS_SUPPORT_ETCD_CLUSTER_H_

#include <sys/types.h>

#include <string>
#include <vector>

#include "Files.h"

namespace karst_test {

struct EtcdOptions {
  int members = 1;  // 1 or 3
  // Clients talk TLS and must show a certificate.
  bool tls = false;
  // Users "root" and "limited", the latter confined to keys under
  // EtcdCluster::kLimitedPrefix.
  bool auth = false;
};

// Whom a locator or etcdctl speaks for.
struct EtcdClient {
  std::string user = "root";  // "" for nobody; ignored without auth
  bool cert = true;           // shows the client certificate; ignored without TLS
};

// Members are stopped with the object, and killed when the thread that started
// them ends: start a cluster on a thread that outlives it. Throws
// std::runtime_error, with the end of the member's log, when a member does not
// come up within 20 s.
class EtcdCluster {
 public:
  static constexpr const char* kLimitedPrefix = "/limited/";

  explicit EtcdCluster(const EtcdOptions& options = {});
  ~EtcdCluster();

  // "127.0.0.1:PORT" of member "i"'s clients, and of all members, comma separated.
  const std::string& Endpoint(int i) const { return members_.at(i).endpoint; }
  const std::string& Endpoints() const { return endpoints_; }
  // A store locator for keys under "/<prefix>/", all members in it.
  std::string Locator(const std::string& prefix, const EtcdClient& client = {}) const;
  std::string Password(const std::string& user) const;
  std::string CaFile() const { return scratch_.File("ca.pem"); }
  std::string CertFile() const { return scratch_.File("client.pem"); }
  std::string KeyFile() const { return scratch_.File("client.key"); }

  // SIGKILL, and waits for the end.
  void Kill(int i);
  // SIGSTOP and SIGCONT: a member that keeps its connections and answers
  // nothing, as a hung machine would.
  void Pause(int i);
  void Resume(int i);
  // Same folder and ports, killing it first if it runs; returns once every
  // running member is healthy.
  void Restart(int i);
  // Starts every member that is not running, all at once (a lone member of
  // three waits for its peers before it is healthy), and returns once all are.
  void RestartAll();
  // The bytes the running members have sent their clients, all together, by
  // their own count (etcd_network_client_grpc_sent_bytes_total).
  double ClientBytesSent() const;
  // Waits up to 20 s for exactly one running member to lead.
  int LeaderIndex() const;
  // etcdctl's standard output; throws with its error output when it fails.
  // Flags in "args" override those given for the cluster and client.
  std::string Etcdctl(const std::vector<std::string>& args, const EtcdClient& client = {}) const;
  // SIGTERM, then SIGKILL after a grace period.
  void Stop();

 private:
  struct Member {
    std::string dir;  // the data folder within, and the log
    std::vector<std::string> argv;
    std::string endpoint;
    int metricsPort = 0;  // plain HTTP /health and /metrics, whatever the clients use
    pid_t pid = -1;       // -1 when not running
  };
  bool Start();
  bool WaitUp(const char* state);
  void MakeCertificates() const;
  void EnableAuth() const;

  EtcdOptions options_;
  ScratchDir scratch_;
  std::vector<Member> members_;
  std::string endpoints_;
};

// One plain cluster for the whole test program, started at its first use;
// tests keep apart by the prefixes of their locators.
EtcdCluster& SharedEtcdCluster();

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_ETCD_CLUSTER_H_
