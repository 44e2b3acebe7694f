// What could be opened on this box. Relies on Listeners and on the rules. Promises: opens nothing that nobody chose.
#pragma once

#include <string>

#include "Answer.h"

namespace tavo::cli {

// Adds the programs that listen here, and the ports that containers publish, which no rule forwards yet; where blAsk,
// asks which of them to open and opens those.
void OfferListeners(const std::string& szGateway, bool blAsk, Reply& reply);

}  // namespace tavo::cli
