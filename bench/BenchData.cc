#include "BenchData.h"

#include <linux/magic.h>
#include <stdlib.h>
#include <sys/vfs.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <map>
#include <memory>
#include <set>

namespace karst_bench {

namespace {

// splitmix64: fast, and plenty for filler bytes.
struct Rng {
  std::uint64_t state;
  std::uint64_t Next() {
    std::uint64_t z = (state += 0x9e3779b97f4a7c15ull);
    z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ull;
    z = (z ^ (z >> 27)) * 0x94d049bb133111ebull;
    return z ^ (z >> 31);
  }
};

// "prefix" + the number, padded with letters to a length of 10-30 bytes.
std::string Text(const char* prefix, std::size_t i, Rng* rng) {
  std::string s = prefix + std::to_string(i) + "-";
  const std::size_t length = 10 + rng->Next() % 21;
  while (s.size() < length) s.push_back(static_cast<char>('a' + rng->Next() % 26));
  return s;
}

const char* const kNamespaces[] = {"CORRA", "ns-alpha", "ns-beta", "ns-gamma"};

std::string gDir;

void RemoveDir() {
  std::error_code ec;
  if (!gDir.empty()) std::filesystem::remove_all(gDir, ec);
}

}  // namespace

std::string RandomBytes(std::size_t n, std::uint64_t seed) {
  Rng rng{seed};
  std::string s(n, '\0');
  for (std::size_t i = 0; i < n; i += 8) {
    const std::uint64_t v = rng.Next();
    for (std::size_t k = 0; k < 8 && i + k < n; ++k) s[i + k] = static_cast<char>(v >> (8 * k));
  }
  return s;
}

bool SameListing(const std::vector<TavoKarst::KarstPolicyInfo>& a,
                 const std::vector<TavoKarst::KarstPolicyInfo>& b) {
  auto same = [](const TavoKarst::KarstPolicyInfo& x, const TavoKarst::KarstPolicyInfo& y) {
    if (x.name != y.name || x.policy_id != y.policy_id || x.description != y.description ||
        x.generation_number != y.generation_number || x.blobs.size() != y.blobs.size()) {
      return false;
    }
    for (std::size_t i = 0; i < x.blobs.size(); ++i) {
      if (x.blobs[i].blob != y.blobs[i].blob ||
          x.blobs[i].datastore_namespace != y.blobs[i].datastore_namespace) {
        return false;
      }
    }
    return true;
  };
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), same);
}

const std::vector<TavoKarst::KarstPolicyInfo>& Policies(std::size_t n) {
  static std::map<std::size_t, std::unique_ptr<std::vector<TavoKarst::KarstPolicyInfo>>> cache;
  auto& slot = cache[n];
  if (!slot) {
    slot = std::make_unique<std::vector<TavoKarst::KarstPolicyInfo>>(n);
    Rng rng{n};
    for (std::size_t i = 0; i < n; ++i) {
      TavoKarst::KarstPolicyInfo& p = (*slot)[i];
      p.name = Text("policy-", i, &rng);
      p.policy_id = Text("id-", i, &rng);
      p.description = Text("tier-", i % 7, &rng);
      p.generation_number = static_cast<std::int64_t>(i * 7 + 1);
      for (const char* ns : kNamespaces) p.blobs.push_back({RandomBytes(256, rng.Next()), ns});
    }
  }
  return *slot;
}

const std::vector<TavoKarst::KarstDatastoreInfo>& Datastores(std::size_t n) {
  static std::map<std::size_t, std::unique_ptr<std::vector<TavoKarst::KarstDatastoreInfo>>> cache;
  auto& slot = cache[n];
  if (!slot) {
    const auto& policies = Policies(n);
    slot = std::make_unique<std::vector<TavoKarst::KarstDatastoreInfo>>(n);
    for (std::size_t i = 0; i < n; ++i) {
      (*slot)[i] = {"ds://host-" + std::to_string(i), kNamespaces[1 + i % 3],
                    policies[(i * 7919) % n].policy_id};
    }
  }
  return *slot;
}

const std::string& StoreDir() {
  if (gDir.empty()) {
    const char* base = std::getenv("KARST_BENCH_DIR");
    std::string root = (base != nullptr && *base != '\0')
                           ? std::string(base)
                           : std::filesystem::temp_directory_path().string();
    std::filesystem::create_directories(root);
    std::string pattern = root + "/karst-bench-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) {
      std::perror("mkdtemp");
      std::exit(2);
    }
    gDir = pattern;
    // KARST_BENCH_KEEP=1 leaves the files for inspection.
    const char* keep = std::getenv("KARST_BENCH_KEEP");
    if (keep == nullptr || std::string(keep) != "1") std::atexit(RemoveDir);
  }
  return gDir;
}

std::string StoreDirKind() {
  struct statfs fs {};
  if (statfs(StoreDir().c_str(), &fs) != 0) return "unknown";
  if (fs.f_type == TMPFS_MAGIC || fs.f_type == RAMFS_MAGIC) return "tmpfs";
  if (fs.f_type == OVERLAYFS_SUPER_MAGIC) return "overlayfs";
  if (fs.f_type == EXT4_SUPER_MAGIC) return "ext4 (disk)";
  if (fs.f_type == XFS_SUPER_MAGIC) return "xfs (disk)";
  if (fs.f_type == BTRFS_SUPER_MAGIC) return "btrfs (disk)";
  char magic[32];
  std::snprintf(magic, sizeof magic, "fs magic 0x%lx", static_cast<unsigned long>(fs.f_type));
  return magic;
}

void UseKarstStore(const std::string& name) {
  setenv("TAVO_CONFIGSTORE_PATH", (StoreDir() + "/" + name).c_str(), 1);
}

std::string FilledKarstStorePath(std::size_t n) {
  return StoreDir() + "/karst-read-" + std::to_string(n) + ".db";
}

void UseFilledKarstStore(std::size_t n) {
  static std::set<std::size_t> filled;
  setenv("TAVO_CONFIGSTORE_PATH", FilledKarstStorePath(n).c_str(), 1);
  if (filled.insert(n).second) {
    TavoKarst::KarstLib::AddPolicyInfo(Policies(n));
    TavoKarst::KarstLib::AddDatastoreInfo(Datastores(n));
  }
}

}  // namespace karst_bench
