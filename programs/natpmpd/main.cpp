// natpmpd: keeps the router's NAT-PMP port mappings in line with the box's rules.
// Relies on the frame of the daemons and on NatpmpMapper. Promises: one instance; see --help.
#include <memory>

#include "programs/common/Daemon.h"
#include "programs/natpmpd/NatpmpMapper.h"

int main(int argc, char** argv) {
    return tavo::DaemonMain(argc, argv, tavo::kNatpmpNames, [] { return std::make_unique<tavo::NatpmpMapper>(); });
}
