// Listens on ports of the box where nobody else does, for the time of a test, and answers the checker's probes.
// Relies on a thread of its own. Promises: only a right probe is answered or counted; everything ends with
// the object.
#pragma once

#include <netinet/in.h>

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "ground/Descriptor.h"

namespace tavo {

enum class ListenEnd {
    kOurs,
    kTaken,     // a program of the box has the port
    kForbidden  // this process may not have it
};

class Responder {
public:
    Responder(in_addr local, std::string szProbe, std::string szAnswer);
    ~Responder();
    Responder(const Responder&) = delete;
    Responder& operator=(const Responder&) = delete;

    // On the box's own address; a port asked for again is ours already. Not after Start.
    ListenEnd Listen(bool blTcp, uint16_t nBoxPort);
    // Answers from now on. Without a listener nothing is started.
    void Start();
    // Whether the probe that was sent to this port of the router has arrived.
    bool HasArrived(bool blTcp, uint16_t nRouterPort);

private:
    struct Caller {
        Descriptor fd;
        std::string szText;
    };

    void Run();
    void TakeDatagrams(int fd);
    void TakeCaller(int fd);
    bool Hear(Caller& caller);
    std::string Recognise(bool blTcp, const std::string& szText);

    in_addr mLocal;
    std::string mSzProbe;
    std::string mSzAnswer;
    std::map<std::pair<bool, uint16_t>, Descriptor> mMapListeners;
    std::vector<Caller> mRgCallers;
    Descriptor mFdStop;
    std::mutex mMutex;
    std::set<std::pair<bool, uint16_t>> mSetArrived;
    std::thread mThread;
};

}  // namespace tavo
