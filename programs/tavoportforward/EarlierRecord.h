// The record as an earlier version kept it: on a router that shows no list it is the only memory of what is open there.
#pragma once

#include "programs/common/MadeFile.h"

namespace tavo {

// Takes over what of it can be read, once; one that is damaged is put aside.
void TakeOverEarlierRecord(MadeFile& made);

}  // namespace tavo
