// upnpd: keeps the router's UPnP port mappings in line with the box's rules.
// Relies on the frame of the daemons and on UpnpMapper. Promises: one instance; see --help.
#include <cstdio>
#include <cstring>

#include "daemons/common/Daemon.h"
#include "daemons/upnpd/UpnpMapper.h"

namespace {

constexpr char kHelp[] =
    "Usage: upnpd [--foreground]\n"
    "Keeps the UPnP port mappings of the router in line with /etc/portforward/rule.conf.\n"
    "\n"
    "  --foreground  stay attached to the terminal\n"
    "  --help        this text\n"
    "\n"
    "SIGHUP reads the rules again; SIGTERM takes the mappings away and ends.\n"
    "The results stand in /var/tmp/upnp_portmap.status, the pid in /var/run/upnpd.pid.\n"
    "It maps only while runupnpportmapping=\"yes\" stands in /etc/tavoinfo.conf.\n";

constexpr tavo::DaemonNames kNames{"upnpd", "/var/run/upnpd.pid", "/var/run/upnpd.lock"};

}  // namespace

int main(int argc, char** argv) {
    bool blForeground = false;
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--help") == 0) {
            std::fputs(kHelp, stdout);
            return 0;
        }
        if (std::strcmp(argv[i], "--foreground") != 0) {
            std::fprintf(stderr, "upnpd: unknown argument '%s'\n\n%s", argv[i], kHelp);
            return 2;
        }
        blForeground = true;
    }
    tavo::UpnpMapper mapper;
    return tavo::RunDaemon(kNames, mapper, blForeground);
}
