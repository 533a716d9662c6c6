// A host program: stores a small catalogue, reads it back and prints the
// digests. Built against an installed libkarst.

#include <TavoConfigStore/ConfigStoreException.h>
#include <TavoKarst/KarstLib.h>

#include <cstdio>

int main() {
  using TavoKarst::KarstLib;
  try {
    TavoKarst::KarstPolicyInfo gold;
    gold.name = "gold";
    gold.policy_id = "p-0001";
    gold.description = "Gold tier";
    gold.generation_number = 7;
    gold.blobs = {{"BLOB-B", "ns-beta"}, {"BLOB-A", "ns-alpha"}};
    KarstLib::AddPolicyInfo({gold});
    KarstLib::AddDatastoreInfo({{"store-a", "ns-alpha", "p-0001"}});

    const auto policies = KarstLib::ListPolicyInfo();
    const auto datastores = KarstLib::ListDatastoreInfo();
    std::printf("%zu policies, %zu datastores\n", policies.size(), datastores.size());
    std::printf("default blob of store-a: %s\n", KarstLib::GetDefaultPolicyBlob("store-a").c_str());
    const auto hash = KarstLib::GetDbHash();
    std::printf("hash: %s %s\n", hash.first.c_str(), hash.second.c_str());
    return hash.first == "1d16fe03" && hash.second == "7f2b5469" ? 0 : 1;
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    std::fprintf(stderr, "consumer: store error %d: %s\n", e.Code(), e.what());
    return 1;
  }
}
