#include "EtcdCluster.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <sstream>
#include <stdexcept>

#include "Certificates.h"
#include "Child.h"

namespace karst_test {
namespace {

using Clock = std::chrono::steady_clock;
// A member that restarts after many writes applies what it missed first; on
// a busy machine that takes a while.
constexpr int kUpWithinSeconds = 60;
constexpr auto kUpWithin = std::chrono::seconds(kUpWithinSeconds);
constexpr const char* kServing = "HTTP/";
constexpr const char* kHealthy = "\"health\":\"true\"";
// Escapes that the locator's parser needs: '@', '/', '%' and ':' are in them.
constexpr const char* kRootPassword = "r00t/p@ss%w:rd";
constexpr const char* kLimitedPassword = "l1m1ted&pw";

sockaddr_in Loopback(int port) {
  return {AF_INET, htons(static_cast<in_port_t>(port)), {htonl(INADDR_LOOPBACK)}, {}};
}

// Ports that were free a moment ago, all different; another process may still
// take one before etcd binds it.
std::vector<int> FreePorts(int count) {
  std::vector<int> fds;
  std::vector<int> ports;
  while (static_cast<int>(ports.size()) < count) {
    sockaddr_in addr = Loopback(0);
    socklen_t size = sizeof addr;
    fds.push_back(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (bind(fds.back(), reinterpret_cast<sockaddr*>(&addr), size) != 0 ||
        getsockname(fds.back(), reinterpret_cast<sockaddr*>(&addr), &size) != 0) {
      throw std::runtime_error(std::string("no free port: ") + std::strerror(errno));
    }
    ports.push_back(ntohs(addr.sin_port));
  }
  for (const int fd : fds) close(fd);
  return ports;
}

// A member's answer to GET "path" on its metrics port; "" while it has none.
std::string HttpGet(int port, const std::string& path) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const timeval timeout{1, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  const sockaddr_in addr = Loopback(port);
  std::string response;
  if (connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0) {
    WriteAll(fd, "GET " + path + " HTTP/1.0\r\n\r\n");
    char buffer[16384];
    for (ssize_t n = 0; (n = read(fd, buffer, sizeof buffer)) > 0;) response.append(buffer, n);
  }
  close(fd);
  return response;
}

std::vector<std::string> Words(const std::string& text) {
  std::istringstream in(text);
  return {std::istream_iterator<std::string>(in), std::istream_iterator<std::string>()};
}

// A process that dies with the calling thread, its output appended to "log".
pid_t Spawn(const std::vector<std::string>& argv, const std::string& log) {
  const pid_t parent = getpid();
  const pid_t pid = fork();
  if (pid == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) _exit(4);
    const int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(fd, STDOUT_FILENO);
    dup2(fd, STDERR_FILENO);
    // An inherited pipe would keep its reader waiting for EOF as long as etcd runs.
    close_range(3, ~0U, 0);
    Exec(argv);
  }
  if (pid < 0) throw std::runtime_error(std::string("fork: ") + std::strerror(errno));
  return pid;
}

void KillAndReap(pid_t pid) {
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
}

// Standard output, running in "dir"; throws with the error output when the
// program fails.
std::string Run(const std::vector<std::string>& argv, const std::string& dir) {
  const std::string errors = dir + "/run-errors";
  const ChildResult result = RunChild(
      [&](int fd) {
        dup2(fd, STDOUT_FILENO);
        dup2(open(errors.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDERR_FILENO);
        if (chdir(dir.c_str()) != 0) throw std::runtime_error("cannot enter " + dir);
        Exec(argv);
      },
      60);
  if (result.Ok()) return result.output;
  std::string command;
  for (const std::string& a : argv) command += a + " ";
  throw std::runtime_error(command + "failed: " + result.Describe() + ReadFile(errors));
}

// %XX for all but letters, digits and "keep".
std::string Escape(const std::string& text, const char* keep) {
  std::string out;
  for (const unsigned char c : text) {
    char hex[4];
    std::snprintf(hex, sizeof hex, "%%%02X", c);
    out += std::isalnum(c) || std::strchr(keep, c) ? std::string(1, static_cast<char>(c)) : hex;
  }
  return out;
}

}  // namespace

EtcdCluster::EtcdCluster(const EtcdOptions& options) : options_(options) {
  try {
    if (options_.tls) MakeCertificates();
    for (int attempt = 1; !Start(); ++attempt) {
      Stop();
      if (attempt == 3) throw std::runtime_error("etcd lost a port to another process 3 times");
    }
    if (options_.auth) EnableAuth();
  } catch (...) {
    Stop();
    throw;
  }
}

EtcdCluster::~EtcdCluster() { Stop(); }

// False when a member lost a port between picking and binding it.
bool EtcdCluster::Start() {
  const std::vector<int> ports = FreePorts(3 * options_.members);
  members_.assign(options_.members, Member());
  // Peers talk plain HTTP: with TLS, each member stopping waits a second for
  // its peers' connections.
  std::string initialCluster;
  endpoints_.clear();
  for (std::size_t i = 0; i < members_.size(); ++i) {
    members_[i].endpoint = "127.0.0.1:" + std::to_string(ports[3 * i + 1]);
    endpoints_ += (i == 0 ? "" : ",") + members_[i].endpoint;
    initialCluster +=
        ",m" + std::to_string(i) + "=http://127.0.0.1:" + std::to_string(ports[3 * i]);
  }
  for (std::size_t i = 0; i < members_.size(); ++i) {
    Member& m = members_[i];
    m.dir = scratch_.File("m" + std::to_string(i));
    std::filesystem::remove_all(m.dir);
    std::filesystem::create_directory(m.dir);
    m.metricsPort = ports[3 * i + 2];
    const std::string peerUrl = "http://127.0.0.1:" + std::to_string(ports[3 * i]);
    const std::string clientUrl = (options_.tls ? "https://" : "http://") + m.endpoint;
    // Loopback needs no more than a few milliseconds a heartbeat, and short
    // elections keep starts and failovers quick. A member replays its log
    // from the last snapshot when it starts: a snapshot every thousand
    // entries keeps a restart after many large replaces within seconds
    // (without one, the whole log of a long test, a gigabyte, is replayed).
    m.argv = Words(
        "etcd --heartbeat-interval=25 --election-timeout=250 --snapshot-count=1000 "
        "--logger=zap --log-outputs=stderr");
    m.argv.insert(m.argv.end(),
                  {"--name=m" + std::to_string(i), "--data-dir=" + m.dir + "/data",
                   "--listen-client-urls=" + clientUrl, "--advertise-client-urls=" + clientUrl,
                   "--listen-peer-urls=" + peerUrl, "--initial-advertise-peer-urls=" + peerUrl,
                   "--initial-cluster=" + initialCluster.substr(1),
                   "--listen-metrics-urls=http://127.0.0.1:" + std::to_string(m.metricsPort)});
    if (options_.tls) {
      m.argv.insert(m.argv.end(), {"--cert-file=" + scratch_.File("server.pem"),
                                   "--key-file=" + scratch_.File("server.key"),
                                   "--trusted-ca-file=" + CaFile(), "--client-cert-auth"});
    }
  }
  // A new member first asks its peers whether the cluster exists already,
  // waiting a second on any that has bound its port but serves nothing yet.
  for (Member& m : members_) {
    m.pid = Spawn(m.argv, m.dir + "/etcd.log");
    if (!WaitUp(kServing)) return false;
  }
  return WaitUp(kHealthy);
}

// Waits for every running member's /health to say "state"; false when one
// died of a port taken meanwhile.
bool EtcdCluster::WaitUp(const char* state) {
  const auto deadline = Clock::now() + kUpWithin;
  for (;; usleep(20000)) {
    bool up = true;
    for (std::size_t i = 0; i < members_.size(); ++i) {
      Member& m = members_[i];
      if (m.pid < 0 || HttpGet(m.metricsPort, "/health").find(state) != std::string::npos) continue;
      up = false;
      const bool died = WaitFor(m.pid, 0) != -1;
      if (!died && Clock::now() <= deadline) continue;
      if (died) m.pid = -1;
      std::string log = ReadFile(m.dir + "/etcd.log");
      log.erase(0, log.size() > 3000 ? log.size() - 3000 : 0);
      if (died && log.find("address already in use") != std::string::npos) return false;
      throw std::runtime_error(
          "etcd member " + std::to_string(i) +
          (died ? " ended" : " is not up after " + std::to_string(kUpWithinSeconds) + " s") +
          "; the end of its log:\n" + log);
    }
    if (up) return true;
  }
}

// The client's name is no user's: only a password lets it in once auth is on.
void EtcdCluster::MakeCertificates() const {
  const CertificateFiles ca = MakeCa(scratch_.Path(), "ca");
  MakeSigned(scratch_.Path(), "server", ca, {}, "IP:127.0.0.1");
  MakeSigned(scratch_.Path(), "client", ca);
}

void EtcdCluster::EnableAuth() const {
  const std::vector<std::string> steps[] = {
      {"user", "add", std::string("root:") + kRootPassword},
      {"role", "add", "limited"},
      {"role", "grant-permission", "limited", "--prefix=true", "readwrite", kLimitedPrefix},
      {"user", "add", std::string("limited:") + kLimitedPassword},
      {"user", "grant-role", "limited", "limited"},
      {"auth", "enable"}};
  for (const auto& args : steps) Etcdctl(args, {"", true});
}

std::string EtcdCluster::Password(const std::string& user) const {
  if (user == "root") return kRootPassword;
  if (user == "limited") return kLimitedPassword;
  throw std::invalid_argument("no etcd user \"" + user + "\"");
}

std::string EtcdCluster::Locator(const std::string& prefix, const EtcdClient& client) const {
  std::string locator = options_.tls ? "etcds://" : "etcd://";
  if (options_.auth && !client.user.empty()) {
    locator += Escape(client.user, "-._~") + ":" + Escape(Password(client.user), "-._~") + "@";
  }
  locator += Endpoints() + "/" + Escape(prefix, "-._~/");
  if (options_.tls) locator += "?cacert=" + Escape(CaFile(), "-._~/");
  if (options_.tls && client.cert) {
    locator += "&cert=" + Escape(CertFile(), "-._~/") + "&key=" + Escape(KeyFile(), "-._~/");
  }
  return locator;
}

void EtcdCluster::Kill(int i) {
  if (members_.at(i).pid > 0) KillAndReap(members_[i].pid);
  members_[i].pid = -1;
}

void EtcdCluster::Pause(int i) {
  if (members_.at(i).pid > 0) kill(members_[i].pid, SIGSTOP);
}

void EtcdCluster::Resume(int i) {
  if (members_.at(i).pid > 0) kill(members_[i].pid, SIGCONT);
}

void EtcdCluster::Restart(int i) {
  Kill(i);
  members_[i].pid = Spawn(members_[i].argv, members_[i].dir + "/etcd.log");
  if (!WaitUp(kHealthy)) {
    throw std::runtime_error("etcd member " + std::to_string(i) + " lost a port");
  }
}

void EtcdCluster::RestartAll() {
  for (Member& m : members_) {
    if (m.pid < 0) m.pid = Spawn(m.argv, m.dir + "/etcd.log");
  }
  if (!WaitUp(kHealthy)) throw std::runtime_error("an etcd member lost a port");
}

double EtcdCluster::ClientBytesSent() const {
  const std::string name = "\netcd_network_client_grpc_sent_bytes_total ";
  double sent = 0;
  for (const Member& m : members_) {
    if (m.pid < 0) continue;
    const std::string metrics = HttpGet(m.metricsPort, "/metrics");
    const std::size_t at = metrics.find(name);
    if (at == std::string::npos) throw std::runtime_error("etcd's /metrics has no " + name);
    sent += std::stod(metrics.substr(at + name.size()));
  }
  return sent;
}

int EtcdCluster::LeaderIndex() const {
  for (const auto deadline = Clock::now() + kUpWithin; Clock::now() < deadline; usleep(20000)) {
    std::vector<int> leaders;
    for (std::size_t i = 0; i < members_.size(); ++i) {
      const std::string metrics = HttpGet(members_[i].metricsPort, "/metrics");
      if (members_[i].pid > 0 && metrics.find("\netcd_server_is_leader 1") != std::string::npos) {
        leaders.push_back(static_cast<int>(i));
      }
    }
    if (leaders.size() == 1) return leaders[0];
  }
  throw std::runtime_error("no single etcd leader after " + std::to_string(kUpWithinSeconds) +
                           " s");
}

std::string EtcdCluster::Etcdctl(const std::vector<std::string>& args,
                                 const EtcdClient& client) const {
  std::vector<std::string> argv = {"etcdctl", "--endpoints=" + Endpoints()};
  if (options_.tls) argv.push_back("--cacert=" + CaFile());
  if (options_.tls && client.cert) {
    argv.insert(argv.end(), {"--cert=" + CertFile(), "--key=" + KeyFile()});
  }
  if (options_.auth && !client.user.empty()) {
    argv.push_back("--user=" + client.user + ":" + Password(client.user));
  }
  argv.insert(argv.end(), args.begin(), args.end());
  return Run(argv, scratch_.Path());
}

// One after the other, each with a short grace: a stopping leader hands its
// leadership to the peer connected longest and waits seconds for one that has
// just gone.
void EtcdCluster::Stop() {
  for (Member& m : members_) {
    if (m.pid < 0) continue;
    kill(m.pid, SIGTERM);
    kill(m.pid, SIGCONT);  // a paused member acts on it
    if (WaitFor(m.pid, 0.5) == -1) KillAndReap(m.pid);
    m.pid = -1;
  }
}

EtcdCluster& SharedEtcdCluster() {
  static EtcdCluster cluster;
  return cluster;
}

}  // namespace karst_test
