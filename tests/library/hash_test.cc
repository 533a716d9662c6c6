// The catalogue digests and the CRC-32 beneath them.

#include <gtest/gtest.h>
#include <zlib.h>

#include <algorithm>
#include <random>

#include "MemoryStoreFixture.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "hash/Crc32.h"
#include "hash/DbHash.h"

namespace karst_test {
namespace {

using TavoKarst::Crc32Hex;
using TavoKarst::KarstLib;
using Hash = std::pair<std::string, std::string>;

TEST(Crc32Test, KnownValuesAndHexForm) {
  EXPECT_EQ(Crc32Hex("123456789"), "cbf43926");
  EXPECT_EQ(Crc32Hex("c"), "6b9df6f");  // no leading zero
  EXPECT_EQ(Crc32Hex(""), "");          // not "0"
  EXPECT_EQ(Crc32Hex("goldp-0001Gold tier7ns-alphaBLOB-Ans-betaBLOB-B"), "83d146fc");
  EXPECT_EQ(Crc32Hex(std::string("\0", 1)), "d202ef8d");
}

TEST(Crc32Test, MatchesZlibAtEveryLengthAndAlignment) {
  std::mt19937 rng(20261123);
  std::vector<unsigned char> buffer(4096 + 16);
  for (auto& b : buffer) b = static_cast<unsigned char>(rng());
  for (std::size_t length = 0; length <= 4096; ++length) {
    const std::size_t offset = length % 8;
    const unsigned char* p = buffer.data() + offset;
    const auto expected = static_cast<std::uint32_t>(crc32(0L, p, static_cast<uInt>(length)));
    ASSERT_EQ(TavoKarst::Crc32(p, length), expected) << "length " << length;
    ASSERT_EQ(TavoKarst::Crc32Bytewise(p, length), expected) << "length " << length;
    ASSERT_EQ(TavoKarst::Crc32Portable(p, length), expected) << "length " << length;
    ASSERT_EQ(TavoKarst::Crc32Clmul(p, length), expected) << "length " << length;
    ASSERT_EQ(TavoKarst::Crc32Avx512(p, length), expected) << "length " << length;
    const std::string text(reinterpret_cast<const char*>(p), length);
    char hex[9];
    std::snprintf(hex, sizeof hex, "%x", expected);
    ASSERT_EQ(Crc32Hex(text), length == 0 ? "" : hex);
  }
  if (!TavoKarst::CpuHasClmul()) std::printf("note: no PCLMULQDQ here, folding path not run\n");
  if (!TavoKarst::CpuHasAvx512Clmul()) {
    std::printf("note: no VPCLMULQDQ with AVX-512 here, 512-bit folding path not run\n");
  }
  // Long texts run the wide paths' main loops many times over, and every
  // path continues a CRC begun by another.
  std::vector<unsigned char> big((1 << 20) + 77);
  for (auto& b : big) b = static_cast<unsigned char>(rng());
  for (std::size_t length : {std::size_t{256 * 1024}, big.size() - 3}) {
    const auto expected =
        static_cast<std::uint32_t>(crc32(0L, big.data() + 3, static_cast<uInt>(length)));
    EXPECT_EQ(TavoKarst::Crc32(big.data() + 3, length), expected);
    EXPECT_EQ(TavoKarst::Crc32Portable(big.data() + 3, length), expected);
    EXPECT_EQ(TavoKarst::Crc32Clmul(big.data() + 3, length), expected);
    EXPECT_EQ(TavoKarst::Crc32Avx512(big.data() + 3, length), expected);
    const std::uint32_t head = TavoKarst::Crc32Portable(big.data() + 3, 1001);
    EXPECT_EQ(TavoKarst::Crc32Avx512(big.data() + 1004, length - 1001, head), expected);
    EXPECT_EQ(TavoKarst::Crc32Clmul(big.data() + 1004, length - 1001,
                                    TavoKarst::Crc32Avx512(big.data() + 3, 1001)),
              expected);
  }
  // Continuing a CRC over a split text gives the CRC of the whole.
  const std::uint32_t head = TavoKarst::Crc32(buffer.data(), 1000);
  EXPECT_EQ(TavoKarst::Crc32(buffer.data() + 1000, 3000, head),
            TavoKarst::Crc32(buffer.data(), 4000));
}

class DbHashTest : public MemoryStoreTest {};

const TavoKarst::KarstPolicyInfo kGold =
    Policy("gold", "p-0001", {{"BLOB-B", "ns-beta"}, {"BLOB-A", "ns-alpha"}}, "Gold tier", 7);
const TavoKarst::KarstPolicyInfo kSilver = Policy("silver", "p-0000", {}, "", -3);

TEST_F(DbHashTest, WorkedExample) {
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("", ""));
  KarstLib::AddPolicyInfo({kGold});
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("1d16fe03", ""));
  KarstLib::AddPolicyInfo({kGold, kSilver});
  EXPECT_EQ(KarstLib::GetDbHash().first, "9bcfe5e8");
  KarstLib::AddDatastoreInfo({Datastore("store-a", "ns-alpha", "p-0001")});
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("9bcfe5e8", "7f2b5469"));
  KarstLib::Reset();
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("", ""));
}

TEST_F(DbHashTest, IndependentOfListingOrder) {
  std::vector<TavoKarst::KarstPolicyInfo> policies = {
      kGold, kSilver, Policy("bronze", "\xff-high", {{"z", "\x01"}, {"y", "\xff"}, {"x", "a"}}),
      Policy("twin-a", "p-dup", {{"1", "n"}}), Policy("twin-b", "p-dup", {{"2", "n"}}),
      // Keys that agree well past their first differing byte from the
      // others, tied and untied.
      Policy("long-a", "p-0123456789abcdef-x", {{"3", "n"}}),
      Policy("long-b", "p-0123456789abcdef-x", {{"4", "n"}}),
      Policy("long-c", "p-0123456789abcdef-y", {{"5", "n"}})};
  std::vector<TavoKarst::KarstDatastoreInfo> datastores = {
      Datastore("b", "1", "2"), Datastore("a", "3", "4"), Datastore("\xff", "", ""),
      Datastore("", "only-namespace", "")};
  KarstLib::AddPolicyInfo(policies);
  KarstLib::AddDatastoreInfo(datastores);
  const Hash expected = KarstLib::GetDbHash();
  std::mt19937 rng(7);
  for (int round = 0; round < 5; ++round) {
    std::shuffle(policies.begin(), policies.end(), rng);
    for (auto& p : policies) std::shuffle(p.blobs.begin(), p.blobs.end(), rng);
    std::shuffle(datastores.begin(), datastores.end(), rng);
    KarstLib::AddPolicyInfo(policies);
    KarstLib::AddDatastoreInfo(datastores);
    EXPECT_EQ(KarstLib::GetDbHash(), expected);
  }
}

TEST_F(DbHashTest, WhichBytesCount) {
  auto firstFor = [](const TavoKarst::KarstPolicyInfo& p) {
    KarstLib::AddPolicyInfo({p});
    return KarstLib::GetDbHash().first;
  };
  const std::string base = firstFor(Policy("ab", "id", {{"blob", "ns"}}, "d", 1));
  // A NUL ends name, policy_id and description in the text...
  EXPECT_EQ(firstFor(Policy(std::string("ab\0zz", 5), "id", {{"blob", "ns"}}, "d", 1)), base);
  EXPECT_EQ(firstFor(Policy("ab", "id", {{"blob", "ns"}}, std::string("d\0q", 3), 1)), base);
  // ...but not the blob or its namespace.
  EXPECT_NE(firstFor(Policy("ab", "id", {{std::string("blob\0", 5), "ns"}}, "d", 1)), base);
  EXPECT_NE(firstFor(Policy("ab", "id", {{"blob", std::string("ns\0", 3)}}, "d", 1)), base);
  // Fields are joined without separators.
  EXPECT_EQ(firstFor(Policy("a", "bid", {{"blob", "ns"}}, "d", 1)), base);
  EXPECT_NE(firstFor(Policy("ab", "id", {{"blob", "ns"}}, "d", -1)), base);
  EXPECT_EQ(firstFor(Policy("x", "", {}, "", INT64_MIN)),
            Crc32Hex(Crc32Hex("x-9223372036854775808")));

  // Datastores with no bytes at all digest to nothing.
  KarstLib::AddDatastoreInfo({Datastore("", "", ""), Datastore("", "", "")});
  EXPECT_EQ(KarstLib::GetDbHash().second, "");
  KarstLib::AddDatastoreInfo({Datastore(std::string("u\0", 2), "", "")});
  EXPECT_EQ(KarstLib::GetDbHash().second, Crc32Hex(Crc32Hex(std::string("u\0", 2))));
}

TEST_F(DbHashTest, EachSideIgnoresTheOther) {
  KarstLib::AddPolicyInfo({kGold});
  KarstLib::AddDatastoreInfo({Datastore("store-a", "ns-alpha", "p-0001")});
  const Hash before = KarstLib::GetDbHash();
  KarstLib::AddDatastoreInfo({Datastore("store-b", "ns-alpha", "p-0001")});
  const Hash afterDatastore = KarstLib::GetDbHash();
  EXPECT_EQ(afterDatastore.first, before.first);
  EXPECT_NE(afterDatastore.second, before.second);
  KarstLib::AddPolicyInfo({kSilver});
  EXPECT_EQ(KarstLib::GetDbHash().second, afterDatastore.second);
  KarstLib::AddPolicyInfo({});
  EXPECT_EQ(KarstLib::GetDbHash(), Hash("", afterDatastore.second));
}

TEST_F(DbHashTest, ListingFailuresPassThrough) {
  KarstLib::AddPolicyInfo({kGold});
  KarstLib::AddDatastoreInfo({Datastore("store-a", "ns-alpha", "p-0001")});
  probe_->FailStoreError("GetObjects", 2, "datastores unreadable", 51);  // after the policy half
  try {
    KarstLib::GetDbHash();
    ADD_FAILURE() << "no exception";
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    EXPECT_STREQ(e.what(), "datastores unreadable");
    EXPECT_EQ(e.Code(), 51);
  }
  // A policy dropped by the listing is simply absent from the digest.
  probe_->ClearFaults();
  probe_->ClearLog();
  probe_->FailStoreError("GetValue", 1, "bad policy", 52);
  EXPECT_EQ(KarstLib::GetDbHash().first, "");
}

}  // namespace
}  // namespace karst_test
