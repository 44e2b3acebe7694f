// What the rules ask of the router: single mappings, and the rules that cannot be taken apart.
// Relies on the rule file and the run key. Promises: an unreadable rule file is told apart from an
// empty one, so that nothing is taken away because of it.
#pragma once

#include <string>
#include <vector>

#include "upnp/Router.h"

namespace tavo {

struct WantedSet {
    std::vector<RouterMapping> rgMappings;  // client and lease still to be filled
    std::vector<std::string> rgszInvalid;   // rules whose ports cannot be paired, as text for a user
    bool blReadable = true;
};

// Every description that we give begins with this; it tells our mappings from everybody else's.
inline constexpr char kOwnPrefix[] = "tavo:";

// Whether szRunKey of the system settings is "yes".
bool IsRunKeyOn(const char* szRunKey);

// Nothing when szRunKey of the system settings is not "yes".
WantedSet ReadWanted(const char* szRunKey);

// "5000/tcp", as a user reads it.
std::string MappingName(const RouterMapping& mapping);

}  // namespace tavo
