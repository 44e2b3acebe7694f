// Fills requests, sends them and judges the answers. Relies on Operations. Promises: see Session.h.
#include "programs/tavoportforward/Session.h"

#include <algorithm>

namespace tavo {

namespace {

constexpr size_t kMaxEntries = 1024;
constexpr int kSilentLimit = 2;
constexpr char kSilent[] = "the router has stopped answering";
constexpr long kUnauthorised = 401;
constexpr long kForbidden = 403;

bool Fail(StepResult& result, std::string szWhy) {
    result.blDone = false;
    result.szWhy = std::move(szWhy);
    return false;
}

const char* EndText(WebEnd enEnd) {
    switch (enEnd) {
        case WebEnd::kTimeout:
            return "the router did not answer in time";
        case WebEnd::kUnreachable:
            return "the router's web server cannot be reached";
        default:
            return "the router's answer was cut off, too long or no HTTP";
    }
}

bool Holds(const std::string& szPage, const std::string& szText) {
    return szPage.find(szText) != std::string::npos;
}

std::string Changed(const Operation& operation, const std::string& szWhat) {
    return "step \"" + operation.szStep + "\": the page " + operation.szPath + " " + szWhat +
           ": it is not the one that the router's description knows";
}

}  // namespace

StepResult Session::Perform(const std::string& szStep, const Values& values) {
    StepResult result;
    result.blDone = true;
    for (const Operation& operation : mOperations.rgOperations) {
        if (operation.szStep != szStep) {
            continue;
        }
        Values all = values;
        all.insert(mValues.begin(), mValues.end());
        if (!PerformOne(operation, all, result)) {
            break;
        }
    }
    return result;
}

bool Session::PerformOne(const Operation& operation, const Values& values, StepResult& result) {
    std::string szMissing;
    WebRequest request;
    request.szMethod = operation.szMethod;
    auto szPath = FillIn(operation.szPath, values, Encoding::kUrl, szMissing);
    if (operation.szBody) {
        request.szBody =
            FillIn(*operation.szBody, values, operation.blJson ? Encoding::kJson : Encoding::kUrl, szMissing);
        request.rgszHeaders.push_back(operation.blJson ? "Content-Type: application/json"
                                                       : "Content-Type: application/x-www-form-urlencoded");
    }
    for (const auto& [szName, szValue] : operation.rgHeaders) {
        const auto szFilled = FillIn(szValue, values, Encoding::kHeader, szMissing);
        request.rgszHeaders.push_back(szName + ": " + szFilled.value_or(""));
    }
    if (!szMissing.empty()) {
        return Fail(result, "step \"" + operation.szStep + "\": nothing stands for {" + szMissing + "}");
    }
    request.szPath = std::move(*szPath);
    if (mNSilent >= kSilentLimit) {
        result.enEnd = mEnTrouble;
        return Fail(result, kSilent);
    }
    const WebAnswer answer = mClient.Send(request);
    mNSilent = answer.enEnd == WebEnd::kAnswered ? 0 : mNSilent + 1;
    if (answer.enEnd != WebEnd::kAnswered) {
        result.enEnd = mEnTrouble = answer.enEnd;
        result.blAnswered = answer.enEnd == WebEnd::kUnreachable;
        return Fail(result, mNSilent >= kSilentLimit
                                ? kSilent
                                : std::string(EndText(answer.enEnd)) + " (step \"" + operation.szStep + "\")");
    }
    return Judge(operation, answer, result) && Take(operation, answer, result);
}

bool Session::Judge(const Operation& operation, const WebAnswer& answer, StepResult& result) const {
    if (operation.szGone && Holds(answer.szBody, *operation.szGone)) {
        result.blWasGone = true;
        return true;
    }
    const auto fnHolds = [&](const std::string& szText) { return Holds(answer.szBody, szText); };
    const bool blRejected = std::any_of(operation.rgszReject.begin(), operation.rgszReject.end(), fnHolds);
    if (answer.nCode == kUnauthorised || answer.nCode == kForbidden || (blRejected && operation.szStep == kStepLogin)) {
        return Fail(result, "the router does not accept the user name or the password");
    }
    if (blRejected) {
        return Fail(result, "the router refused it");
    }
    if (std::find(operation.rgnStatus.begin(), operation.rgnStatus.end(), answer.nCode) == operation.rgnStatus.end()) {
        return Fail(result, Changed(operation, "answered with status " + std::to_string(answer.nCode)));
    }
    if (!std::all_of(operation.rgszExpect.begin(), operation.rgszExpect.end(), fnHolds)) {
        return Fail(result, Changed(operation, "lacks an expected text"));
    }
    return true;
}

bool Session::Take(const Operation& operation, const WebAnswer& answer, StepResult& result) {
    for (const auto& [szName, pattern] : operation.rgTakes) {
        const auto rgFound = pattern.FindAll(answer.szBody, 1);
        if (!rgFound || rgFound->empty() || !rgFound->front().contains("1")) {
            return Fail(result, Changed(operation, "gave no \"" + szName + "\""));
        }
        mValues[szName] = rgFound->front().at("1");
    }
    if (operation.entry) {
        auto rgFound = operation.entry->FindAll(answer.szBody, kMaxEntries);
        if (!rgFound) {
            return Fail(result, Changed(operation, "cannot be searched"));
        }
        result.rgEntries.insert(result.rgEntries.end(), rgFound->begin(), rgFound->end());
    }
    return true;
}

}  // namespace tavo
