#ifndef KARST_FRAME_RESET_H_
#define KARST_FRAME_RESET_H_

namespace TavoKarst {

// Deletes both collections in one transaction; deletion failures are ignored.
void ResetCatalogue();

}  // namespace TavoKarst

#endif  // KARST_FRAME_RESET_H_
