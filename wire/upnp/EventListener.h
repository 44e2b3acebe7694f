// The ear for what a router tells its subscribers (GENA): NOTIFY requests over TCP, each answered and closed.
// Relies on non-blocking sockets and on the parser of HTTP requests. Promises: never waits; hears the router's address
// only; what it keeps is bounded in number and size, whatever is sent; nobody else can guess its path.
#pragma once

#include <netinet/in.h>

#include <cstdint>
#include <list>
#include <string>
#include <vector>

#include "ground/Descriptor.h"

namespace tavo {

struct EventNotice {
    uint32_t nNumber;  // counts the notices of a subscription; 0: the first, which says how things stand
    std::string szBody;
};

class EventListener {
public:
    // Opens a port of the box's address szLocal, at a path of its own, for the router szRouter. False: it cannot.
    bool Open(const std::string& szLocal, const std::string& szRouter);
    void Close();
    bool IsOpen() const { return mFd.Get() >= 0; }
    // Where the router is to send to.
    std::string Url() const { return mSzUrl; }
    // Readable when somebody spoke.
    std::vector<int> Fds() const;
    // What has come for the subscription szSubscription since the last call, in its order.
    std::vector<EventNotice> Take(const std::string& szSubscription);

private:
    struct Guest {
        Descriptor fd;
        std::string szText;
    };
    void Admit();
    // False: it is done with.
    static bool Hear(Guest& guest);
    std::string Answer(const Guest& guest, const std::string& szSubscription,
                       std::vector<EventNotice>& rgNotices) const;

    Descriptor mFd;
    in_addr mRouter = {};
    std::string mSzUrl;
    std::string mSzPath;
    std::list<Guest> mGuests;  // the oldest first
};

}  // namespace tavo
