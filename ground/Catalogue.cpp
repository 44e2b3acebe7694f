// See Catalogue.h.
#include "ground/Catalogue.h"

#include <utility>

#include "tavo/log.h"

namespace tavo {

namespace {

constexpr std::pair<unsigned, const char*> kCatalogue[] = {
    {TAVO_EVENT_PF_CONFLICT, "The router already uses these ports for something else: "},
    {TAVO_EVENT_PF_ADD_FAILED, "The router has not done what was asked for these ports: "},
    {TAVO_EVENT_PF_PORT_LOST, "Lost on the router: "},
    {TAVO_EVENT_PF_PORT_REFUSED, "Refused by the router: "},
    {TAVO_EVENT_PF_PORT_BACK, "Open on the router now: "},
    {TAVO_EVENT_PF_ROUTER_GONE, "The router is gone: "},
    {TAVO_EVENT_PF_ROUTER_BACK, "The router is back: "},
    {TAVO_EVENT_PF_ROUTER_REPLACED, "The router is another one: "},
    {TAVO_EVENT_PF_ADDRESS_CHANGED, "The outside address has changed: "},
    {TAVO_EVENT_PF_RENEWED, "The router had lost these ports, and has them again: "}};

}  // namespace

const char* EventMessage(unsigned nEvent) {
    for (const auto& [nKnown, szMessage] : kCatalogue) {
        if (nKnown == nEvent) {
            return szMessage;
        }
    }
    return "Event: ";
}

}  // namespace tavo
