// One detection, and what it means together with what the gateway says of itself. Relies on TLibDetectRouter and on the
// seam's net.h. Promises: the process that detection forks never answers a second time; the run keys are as before.
#pragma once

#include <optional>
#include <string>

#include "Verdict.h"
#include "tavo/net.h"

namespace tavo::cli {

struct Detected {
    std::string szGateway = {};
    DetectResult result = {};
    int nResult = -1;
    bool blUpnpAnswers = false;  // whatever is known of its model
    TAVO_NET_GATEWAY_WORD word = {};

    bool IsKnown() const;
    // The verdict is whole but for the number of rules, of which nobody knows.
    bool IsLimitMissing() const;
    bool IsDone() const { return nResult == 0 || IsLimitMissing(); }
};

// Detects, with the router lock held by the caller. What kept it from beginning, or nothing.
std::optional<Reply> Detect(Detected& detected, bool blJson);
// The last verdict; the gateway is not asked anew.
void RecallDetection(Detected& detected);

// What a detection that did not come to its end ran into.
Reply FailedDetection(const Detected& detected);

enum class Finding {
    kKnown,         // UPnP or NAT-PMP, and a database or a test says that it works
    kUntested,      // UPnP answers, and nobody knows how well
    kDistrusted,    // UPnP answers, and the database says that it cannot be relied on
    kNameless,      // UPnP answers, but does not say what the router is
    kSpeaksNatpmp,  // no UPnP, but NAT-PMP's question is answered
    kRefusesNatpmp,
    kNeither,
    kNoRouter  // the box itself has a public address
};
Finding FindingOf(const Detected& detected);
// The gateway answers NAT-PMP and does not refuse.
bool SpeaksNatpmp(const TAVO_NET_GATEWAY_WORD& word);

// The finding in a sentence.
std::string FindingWords(Finding enFinding, const Detected& detected);

// How to have a router driven through its own pages.
extern const char kManualWay[];

}  // namespace tavo::cli
