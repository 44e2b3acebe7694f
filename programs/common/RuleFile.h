// The rules in force, as the settings have them. Relies on the rule file and the run key. Promises: an unreadable rule
// file is told apart from an empty one, so that nothing is taken away because of it.
#pragma once

#include "mapping/Wanted.h"
#include "tavo/portforward.h"

namespace tavo {

// Whether szRunKey of the system settings is "yes".
bool IsRunKeyOn(const char* szRunKey);

// Nothing, and what is the other daemon's, when szRunKey of the system settings is not "yes".
WantedSet ReadWanted(const char* szRunKey);

RuleText RuleTextOf(const TAVO_PF_CONF* pRule);

}  // namespace tavo
