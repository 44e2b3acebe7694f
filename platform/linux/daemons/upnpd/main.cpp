// upnpd: keeps the router's UPnP port mappings in line with the box's rules.
// Relies on the frame of the daemons and on UpnpMapper. Promises: one instance; see --help.
#include "daemons/common/Daemon.h"
#include "daemons/upnpd/UpnpMapper.h"

int main(int argc, char** argv) {
    tavo::UpnpMapper mapper;
    return tavo::DaemonMain(argc, argv, mapper);
}
