// A subscription to what a router's port-mapping service tells of itself (GENA): that its table, or its outside
// address, has changed. Relies on HttpTransport and EventListener. Promises: at most a request or two a call, each
// bounded; only the router is spoken to and heard; what it says is a hint, no more.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ground/BootClock.h"
#include "wire/http/Http.h"
#include "wire/upnp/EventListener.h"

namespace tavo {

class Events {
public:
    explicit Events(std::shared_ptr<HttpTransport> pHttp = std::make_shared<HttpClient>()) : mPHttp(std::move(pHttp)) {}
    ~Events() { End(); }
    Events(const Events&) = delete;
    Events& operator=(const Events&) = delete;

    // Which service to hear, from which address of the box; one that was found anew may have forgotten us. Nothing: it
    // tells nothing.
    void TurnTo(const std::optional<HttpUrl>& service, const std::string& szLocal);
    // Subscribes, or renews, when that is due. One that fails is tried again much later.
    void Keep(BootClock::time_point now, const std::function<bool()>& fnStop);
    // Ends the subscription, at the router too.
    void End();
    // When it is to be kept the next time; nothing without a subscription.
    std::optional<BootClock::time_point> Due() const { return IsSubscribed() ? std::optional(mDue) : std::nullopt; }
    bool IsSubscribed() const { return !mSzSubscription.empty(); }
    // Readable when the router spoke.
    std::vector<int> Fds() const { return mListener.Fds(); }
    // Takes in what was said. True when it is a reason to look at the router's table.
    bool TakeNews();

private:
    bool Ask(const std::vector<std::string>& rgszHeaders, BootClock::time_point now);
    void Forget();

    std::shared_ptr<HttpTransport> mPHttp;
    std::optional<HttpUrl> mService;
    std::string mSzLocal;
    EventListener mListener;
    std::string mSzSubscription;  // the router's name for it; empty: none
    uint32_t mNNext = 0;          // the number that the next notice has
    BootClock::time_point mDue;
};

}  // namespace tavo
