// The operations of a router model as the tool that performs them reads them: the sections of router.ops.
#pragma once

#include "portforward/ConfList.h"

struct tag_TAVO_ROUTER_SCRIPT {
    tavo::ConfList pOperations;  // in file order; null: the model has none, or they cannot be read
};
