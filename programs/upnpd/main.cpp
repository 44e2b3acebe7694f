// upnpd: keeps the router's UPnP port mappings in line with the box's rules, or tests the router.
// Relies on the frame of the daemons and on UpnpMapper, or on TestDaemon. Promises: one instance of each;
// see --help.
#include <cstring>
#include <memory>

#include "programs/common/Daemon.h"
#include "programs/upnpd/TestDaemon.h"
#include "programs/upnpd/UpnpMapper.h"

int main(int argc, char** argv) {
    if (argc == 3 && std::strcmp(argv[1], "--debug") == 0 && std::strcmp(argv[2], "-p") == 0) {
        return tavo::TestDaemon().Run();
    }
    return tavo::DaemonMain(argc, argv, tavo::kUpnpNames, [] { return std::make_unique<tavo::UpnpMapper>(); });
}
