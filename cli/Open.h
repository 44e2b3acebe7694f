// A port opened as by "open". Relies on setup and the save. Promises: as the command.
#pragma once

#include <string>

#include "Answer.h"

namespace tavo::cli {

// szWhat: "443", "53/udp", a name. Asks at the terminal before it opens what should not face the world.
Reply OpenPort(const std::string& szWhat, bool blJson);

}  // namespace tavo::cli
