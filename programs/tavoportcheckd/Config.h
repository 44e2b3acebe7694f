// The configuration of the port checker. Relies on the platform's sectioned files. Promises: whole and sane, or
// refused with a reason; a file that other users can read is refused, as it holds the token.
#pragma once

#include <string>
#include <vector>

#include "programs/tavoportcheckd/Address.h"

namespace tavo {

struct CheckdConfig {
    std::vector<sockaddr_storage> rgListen;
    std::string szToken;
    std::vector<Address> rgTrustedProxies;
    std::string szProxyHeader;
    int nPerAddress = 0;  // requests a minute
    int nTotal = 0;       // requests a minute
    int nAtOnce = 0;      // requests under way
    int nMaxPorts = 0;    // in one request
};

// False with the reason, as text for whoever started the program.
bool ReadConfig(const std::string& szPath, CheckdConfig& config, std::string& szReason);

}  // namespace tavo
