// Whether a description of a router's pages (router.des) says what its readers understand. Relies on nothing.
// Promises: the first thing that is wrong is named.
#pragma once

#include <string>

#include "tavo/portforward.h"

namespace tavo {

// False with szWhy set: an unknown section or key, a value that nobody understands, a page without "max rule".
bool IsGoodDescription(const TAVO_PF_CONF* pSections, std::string& szWhy);

}  // namespace tavo
