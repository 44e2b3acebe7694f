// "setup": from nothing to a known router. Relies on detection, the compatibility test and the platform's look at the
// gateway. Promises: may be run again at any time; opens no port that nobody asked for; a dead end names the way out.
#pragma once

#include "Answer.h"

namespace CLI {
class App;
}

namespace tavo::cli {

struct Request;

struct SetupWish {
    bool blYes = false;   // asks nothing
    bool blOffer = true;  // shows what could be opened, and asks at a terminal
};

// Finds out what the router is and stores it. Takes the router lock itself.
Reply Setup(const SetupWish& wish, bool blJson);

// Whether rules can be saved with what is stored for the current gateway.
bool IsRouterKnown();

// Offers the command, as in Commands.h.
void OfferSetup(CLI::App& app, Request& request);

}  // namespace tavo::cli
