// The publisher of AirPort base stations. Relies on AirportPublisher. Promises: stays in the foreground;
// ends on SIGTERM and takes its file away.
#include <syslog.h>

#include <cstdio>
#include <cstring>

#include "ground/FileLock.h"
#include "ground/SysLog.h"
#include "programs/tavoairportd/Publisher.h"

namespace {

constexpr char kHelp[] =
    "Usage: tavoairportd [--help]\n"
    "Keeps /tmp/airport.tcp.local: one section per AirPort base station that avahi sees on the network,\n"
    "named by its IPv4 address, with its announced name. No base station: no file.\n"
    "Stays in the foreground; SIGTERM ends it. It waits for D-Bus and avahi when they are not running.\n";
constexpr char kList[] = "/tmp/airport.tcp.local";
constexpr char kLock[] = "/var/run/tavoairportd.lock";

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1) {
        const bool blHelp = std::strcmp(argv[1], "--help") == 0;
        std::fputs(kHelp, blHelp ? stdout : stderr);
        return blHelp ? 0 : 2;
    }
    openlog("tavoairportd", LOG_PID, LOG_DAEMON);
    // A second one would take the list of the first away when it ends.
    const tavo::FileLock lock(kLock);
    if (!lock.Try()) {
        tavo::SysLog(LOG_ERR, "another tavoairportd is running (lock %s)", kLock);
        return 1;
    }
    tavo::AirportPublisher publisher(kList);
    return publisher.Run() ? 0 : 1;
}
