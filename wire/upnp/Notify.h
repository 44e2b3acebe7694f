// What a router says of its own accord by SSDP: that it has begun anew, or goes. Relies on one multicast UDP socket.
// Promises: never waits; only what comes from the gateway's address counts, and it is a hint, no more.
#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "ground/Descriptor.h"

namespace tavo {

// What tells one life of a device from the next, in an announcement that it is there: in the second generation a
// number, before that the place of its description. Empty when it says that it goes; nothing for anything else.
std::optional<std::string> LifeOf(std::string_view szMessage);

// The last life of each device of a router: most routers are several. Bounded, whatever is said.
class Lives {
public:
    // Whether a device is heard for the first time, has another life, or says goodbye.
    bool IsNews(std::string_view szMessage);
    void Forget() { mMapLives.clear(); }

private:
    std::map<std::string, std::string> mMapLives;  // by the name that a device has for itself
};

class Announcements {
public:
    // Listens on the network of the box's address szLocal, and forgets what was heard before.
    void Listen(const std::string& szLocal);
    // Readable when something was said; -1 while nobody listens.
    int Fd() const { return mFd.Get(); }
    // Takes in what was said. True when a device of the gateway is news.
    bool TakeNews(const std::string& szGateway);

private:
    Descriptor mFd;
    Lives mLives;
};

}  // namespace tavo
