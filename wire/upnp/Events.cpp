// See Events.h.
#include "wire/upnp/Events.h"

#include <algorithm>
#include <charconv>
#include <string_view>
#include <utility>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr int kAskMilliseconds = 1500;
constexpr int kEndMilliseconds = 1000;
constexpr size_t kMaxName = 256;
constexpr auto kLeastTerm = std::chrono::seconds(60);
constexpr auto kTerm = std::chrono::seconds(1800);
constexpr char kTermHeader[] = "TIMEOUT: Second-1800";
constexpr auto kPause = std::chrono::minutes(10);  // after a router would not

// The second generation counts every change of its table in the last of these.
constexpr std::string_view kOurs[] = {"PortMappingNumberOfEntries", "ExternalIPAddress", "SystemUpdateID"};

bool NamesOurs(const std::string& szBody) {
    return std::any_of(std::begin(kOurs), std::end(kOurs),
                       [&](std::string_view szName) { return szBody.find(szName) != std::string::npos; });
}

// For how long a router grants a subscription; one that says nothing of use grants what was asked for.
std::chrono::seconds TermOf(const std::string& szTimeout) {
    constexpr std::string_view kUnit = "Second-";
    int nSeconds = 0;
    if (szTimeout.size() <= kUnit.size() || !IsSameWord(std::string_view(szTimeout).substr(0, kUnit.size()), kUnit) ||
        std::from_chars(szTimeout.data() + kUnit.size(), szTimeout.data() + szTimeout.size(), nSeconds).ec !=
            std::errc()) {
        return kTerm;
    }
    return std::clamp<std::chrono::seconds>(std::chrono::seconds(nSeconds), kLeastTerm, kTerm);
}

}  // namespace

void Events::TurnTo(const std::optional<HttpUrl>& service, const std::string& szLocal) {
    const std::string szBefore = mService ? mService->Text() : "";
    if (szBefore != (service ? service->Text() : "") || mSzLocal != szLocal) {
        End();
        mService = service;
        mSzLocal = szLocal;
    }
    mDue = {};
}

void Events::Keep(BootClock::time_point now, const std::function<bool()>& fnStop) {
    if (!mService || now < mDue) {
        return;
    }
    mPHttp->SetStop(fnStop);
    mPHttp->SetLimit(kAskMilliseconds);
    if (IsSubscribed() && mListener.IsOpen() && Ask({"SID: " + mSzSubscription, kTermHeader}, now)) {
        return;
    }
    Forget();
    if (!mListener.Open(mSzLocal, mService->szHost) ||
        !Ask({"CALLBACK: <" + mListener.Url() + ">", "NT: upnp:event", kTermHeader}, now)) {
        Forget();
        mDue = now + kPause;
    }
}

bool Events::Ask(const std::vector<std::string>& rgszHeaders, BootClock::time_point now) {
    const HttpAnswer answer = mPHttp->Ask("SUBSCRIBE", *mService, rgszHeaders);
    const std::string szName = answer.headers.Find("SID").value_or(mSzSubscription);
    if (answer.enEnd != HttpEnd::kAnswered || answer.nCode != 200 || szName.empty() ||
        szName != PrintableText(szName, kMaxName)) {
        return false;
    }
    mSzSubscription = szName;
    mDue = now + TermOf(answer.headers.Find("TIMEOUT").value_or("")) / 2;
    return true;
}

void Events::Forget() {
    mListener.Close();
    mSzSubscription.clear();
    mNNext = 0;
}

void Events::End() {
    if (mService && IsSubscribed()) {
        mPHttp->SetStop({});
        mPHttp->SetLimit(kEndMilliseconds);
        mPHttp->Ask("UNSUBSCRIBE", *mService, {"SID: " + mSzSubscription});
    }
    Forget();
    mDue = {};
}

bool Events::TakeNews() {
    bool blNews = false;
    for (const EventNotice& notice : mListener.Take(mSzSubscription)) {
        // One out of turn: the router counts anew, or something that it said did not come.
        blNews = blNews || notice.nNumber != mNNext || (notice.nNumber != 0 && NamesOurs(notice.szBody));
        mNNext = notice.nNumber == UINT32_MAX ? 1 : notice.nNumber + 1;
    }
    return blNews;
}

}  // namespace tavo
