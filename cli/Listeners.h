// Which programs of this box wait for connections, and which ports its containers publish. Relies on /proc/net and,
// where it is installed, on nft. Promises: changes nothing; ends within seconds; what may not be read is left out.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tavo::cli {

struct Listener {
    std::string szProtocol;  // "tcp" or "udp"
    uint16_t nPort = 0;
    std::string szAddress;  // "0.0.0.0" and "::" are every address of the box
    bool blLoopbackOnly = false;
    std::string szProgram;  // empty where it may not be read, and for the kernel's own (WireGuard, NFS)
    bool blContainer = false;

    bool operator==(const Listener&) const = default;
};

// In the order of protocol, port and address, each once. Of UDP these are the sockets that talk to nobody in
// particular, those of programs that ask and wait for an answer among them. Programs of other users need root.
std::vector<Listener> ReadListeners();

// The ports that the rules of the packet filter hand to another network of this box, from nft's JSON.
std::vector<Listener> ReadPublishedPorts(const std::string& szRuleset);

}  // namespace tavo::cli
