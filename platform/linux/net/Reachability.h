// What lies outside the home network: can a host be reached, can a name be resolved.
// Relies on [network] of the platform's settings. Promises: each question ends within seconds, needs no
// root, and runs in the calling process without a thread.
#pragma once

#include <netinet/in.h>

#include <vector>

namespace tavo {

// The hosts of the settings; those that are no "address:port" are left out.
std::vector<sockaddr_in> OutsideHosts();

// Asks all hosts at once, each by a TCP connection and, where the system lets users, by an echo request.
bool AnyReached(const std::vector<sockaddr_in>& rgHosts);

// Whether the box's name servers know an address of the settings' name.
bool IsNameResolved();

}  // namespace tavo
