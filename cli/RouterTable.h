// "router table". Relies on Commands.h. Promises: see RouterTable.cpp.
#pragma once

#include "Commands.h"

namespace tavo::cli {

void OfferRouterTable(CLI::App& router, Request& request);

}  // namespace tavo::cli
