// The catalogue digests and the CRC-32 beneath them.

#include <gtest/gtest.h>
#include <zlib.h>

#include <algorithm>
#include <cstdio>
#include <random>

#include "FaultStore.h"
#include "Records.h"
#include "hash/Crc32.h"

namespace karst_test {
namespace {

using TavoKarst::Crc32Hex;
using TavoKarst::KarstLib;
using Hash = std::pair<std::string, std::string>;

// Every path at every length up to 4 KiB from every alignment, and long
// enough for the wide paths' main loops; each also continues a CRC begun
// elsewhere. The hex form has no leading zeros and is "" for no bytes.
TEST(Crc32Test, EveryPathMatchesZlib) {
  using Path = std::uint32_t (*)(const void*, std::size_t, std::uint32_t);
  const std::pair<const char*, Path> paths[] = {{"Crc32", TavoKarst::Crc32},
                                                {"Bytewise", TavoKarst::Crc32Bytewise},
                                                {"Portable", TavoKarst::Crc32Portable},
                                                {"Clmul", TavoKarst::Crc32Clmul},
                                                {"Avx512", TavoKarst::Crc32Avx512}};
  std::mt19937 rng(20261123);
  std::vector<unsigned char> data((1 << 20) + 77);
  for (auto& b : data) b = static_cast<unsigned char>(rng());
  std::vector<std::size_t> lengths = {256 * 1024, data.size() - 7};
  for (std::size_t length = 0; length <= 4096; ++length) lengths.push_back(length);
  for (std::size_t length : lengths) {
    const unsigned char* p = data.data() + length % 8;
    const auto zlib = [p](std::size_t n) {
      return static_cast<std::uint32_t>(crc32(0L, p, static_cast<uInt>(n)));
    };
    const std::uint32_t expected = zlib(length);
    const std::size_t split = length / 3;
    for (const auto& [name, path] : paths) {
      ASSERT_EQ(path(p, length, 0), expected) << name << " length " << length;
      ASSERT_EQ(path(p + split, length - split, zlib(split)), expected) << name << " " << length;
    }
    char hex[9];
    std::snprintf(hex, sizeof hex, "%x", expected);
    ASSERT_EQ(Crc32Hex(std::string(reinterpret_cast<const char*>(p), length)),
              length == 0 ? "" : hex);
  }
}

const TavoKarst::KarstPolicyInfo kGold =
    Policy("gold", "p-0001", {{"BLOB-B", "ns-beta"}, {"BLOB-A", "ns-alpha"}}, "Gold tier", 7);

TEST(DbHashTest, WorkedExample) {
  ScopedFaultStore store(TavoConfigStore::NewMemoryStore());
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("", ""));
  KarstLib::AddPolicyInfo({kGold, Policy("silver", "p-0000", {}, "", -3)});
  KarstLib::AddDatastoreInfo({Datastore("store-a", "ns-alpha", "p-0001")});
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("9bcfe5e8", "7f2b5469"));
}

// One record's digest is the digest of its text's digest.
TEST(DbHashTest, TextOfOneRecord) {
  ScopedFaultStore store(TavoConfigStore::NewMemoryStore());
  std::vector<std::pair<TavoKarst::KarstPolicyInfo, std::string>> policies = {
      // name, policy_id, description, decimal generation, then each blob's
      // namespace and bytes in ascending namespace order.
      {Policy("ab", "id", {{"2", "z"}, {"1", "y"}}, "d", 1), "abidd1y1z2"},
      {Policy("x", "", {}, "", INT64_MIN), "x-9223372036854775808"},
      // A NUL ends name, policy_id and description, but not a blob or its namespace.
      {Policy(std::string("ab\0z", 4), std::string("i\0", 2), {{"b", "n"}}, std::string("d\0q", 3),
              0),
       "abid0nb"},
      {Policy("a", "i", {{std::string("b\0", 2), std::string("n\0", 2)}}, "", 0),
       std::string("ai0n\0b\0", 7)},
  };
  // Many blobs, given in reverse.
  std::vector<TavoKarst::KarstPolicyBlob> blobs;
  std::string text = "mi0";
  for (int i = 10; i < 30; ++i) {
    blobs.insert(blobs.begin(), {"b" + std::to_string(i), "n" + std::to_string(i)});
    text += "n" + std::to_string(i) + "b" + std::to_string(i);
  }
  policies.push_back({Policy("m", "i", blobs, "", 0), text});
  for (const auto& [policy, text] : policies) {
    KarstLib::AddPolicyInfo({policy});
    EXPECT_EQ(KarstLib::GetDbHash().first, Crc32Hex(Crc32Hex(text)))
        << ::testing::PrintToString(policy);
  }
  KarstLib::AddDatastoreInfo({Datastore(std::string("u\0", 2), "n", "p")});
  EXPECT_EQ(KarstLib::GetDbHash().second, Crc32Hex(Crc32Hex(std::string("u\0np", 4))));
  // Records without bytes digest to nothing.
  KarstLib::AddDatastoreInfo({Datastore("", "", ""), Datastore("", "", "")});
  EXPECT_EQ(KarstLib::GetDbHash().second, "");
}

TEST(DbHashTest, IndependentOfListingOrder) {
  ScopedFaultStore store(TavoConfigStore::NewMemoryStore());
  std::vector<TavoKarst::KarstPolicyInfo> policies = {
      kGold, Policy("bronze", "\xff-high", {{"z", "\x01"}, {"y", "\xff"}, {"x", "a"}}),
      Policy("twin-a", "p-dup", {{"1", "n"}}), Policy("twin-b", "p-dup", {{"2", "n"}}),
      // Keys that agree well past their first 8 bytes, tied and untied.
      Policy("long-a", "p-0123456789abcdef-x", {{"3", "n"}}),
      Policy("long-b", "p-0123456789abcdef-x", {{"4", "n"}}),
      Policy("long-c", "p-0123456789abcdef-y", {{"5", "n"}})};
  std::vector<TavoKarst::KarstDatastoreInfo> datastores = {
      Datastore("b", "1", "2"), Datastore("a", "3", "4"), Datastore("\xff", "", ""),
      Datastore("", "only-namespace", "")};
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  const Hash expected = KarstLib::GetDbHash();
  // Reversed, every pair of records and of blobs changes places.
  std::reverse(policies.begin(), policies.end());
  for (auto& p : policies) std::reverse(p.blobs.begin(), p.blobs.end());
  std::reverse(datastores.begin(), datastores.end());
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  EXPECT_EQ(KarstLib::GetDbHash(), expected);
}

}  // namespace
}  // namespace karst_test
