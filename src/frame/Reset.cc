#include "frame/Reset.h"

#include "frame/WriteBracket.h"

namespace TavoKarst {

void ResetCatalogue() {
  RunInWriteBracket([](const StorePtr& store) {
    // Each clearing swallows its own error, so one failed deletion neither
    // stops the other nor prevents the commit.
    ClearPolicies(store, true);
    ClearDatastores(store, true);
  });
}

}  // namespace TavoKarst
