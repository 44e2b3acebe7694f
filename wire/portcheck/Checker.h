// Asks the port checker outside about ports of the router. Relies on [portcheck] of the platform's settings.
// Promises: an answer is whole and about what was asked, or it is none, with the reason as text for a user;
// whatever the checker sends, a request ends in time.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "wire/http/Http.h"
#include "wire/portcheck/Protocol.h"

namespace tavo {

struct CheckerSettings {
    std::string szUrl;  // empty: none configured
    std::string szToken;
    size_t nPortsPerRequest;
    size_t nMaxPorts;  // in one test
};
CheckerSettings ReadCheckerSettings();

// 128 random bits as text.
std::string MakeNonce();

struct CheckerAnswer {
    std::vector<PortFinding> rgFindings;  // one for each port asked about, in order; empty: see szReason
    std::string szReason;
};

class Checker {
public:
    explicit Checker(CheckerSettings settings);
    // nMilliseconds: until the answer must be there.
    CheckerAnswer Ask(const std::vector<CheckedPort>& rgPorts, const std::string& szProbe, const std::string& szAnswer,
                      int nMilliseconds);

private:
    CheckerSettings mSettings;
    std::optional<HttpUrl> mUrl;
    HttpClient mHttp;
};

// The findings in an answer's body; none, with a reason, for anything but a whole and fitting answer.
CheckerAnswer ReadCheckerAnswer(const std::string& szBody, const std::vector<CheckedPort>& rgPorts);

}  // namespace tavo
