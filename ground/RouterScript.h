// The operations of a router model as the tool that performs them reads them: the sections of router.ops.
#pragma once

#include "ground/ConfList.h"

namespace tavo {

// The version of the syntax of descriptions and operations that this box understands.
inline constexpr int kSyntaxVersion = 1;

}  // namespace tavo

struct tag_TAVO_ROUTER_SCRIPT {
    tavo::ConfList pOperations;  // in file order; null: the model has none, or they cannot be read
};
