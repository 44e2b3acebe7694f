// Port lists as text, and a rule taken apart into single mappings; shared with the daemons.
// Relies on nothing. Promises: strict: anything but ports, ranges, commas and blanks is refused.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tavo {

struct PortRange {
    uint16_t nFirst;
    uint16_t nLast;  // not below nFirst
};

struct SingleMapping {
    std::string szProtocol;  // "TCP" or "UDP"
    uint16_t nRouterPort;
    uint16_t nBoxPort;
    bool operator==(const SingleMapping&) const = default;
};

// "5000/tcp", as a user reads it; szProtocol is that of a SingleMapping.
std::string PortName(std::string_view szProtocol, uint16_t nPort);

// "80", "80,443", "5000-5010"; a range written backwards counts forwards. Nothing for an empty text or
// a port outside 1 to 65535.
std::optional<std::vector<PortRange>> ParsePortRanges(std::string_view szText);

// "tcp", "udp", "all" (also "both", "tcp_udp") in any case: whether it takes in each of the two.
struct ProtocolSet {
    bool blTcp;
    bool blUdp;
};
std::optional<ProtocolSet> ParseProtocol(std::string_view szText);

// Whether a list of ports fills a record to its end. The library cuts what does not fit, in the middle of a number
// perhaps: then the last item names ports that nobody wrote.
bool MayBeCut(std::string_view szPorts);

// The n-th router port with the n-th box port, for each protocol. Nothing when a text cannot be read or
// the two sides have different numbers of ports. Of a list that may be cut, what stands before its last item.
std::optional<std::vector<SingleMapping>> ExpandRule(std::string_view szProtocol, std::string_view szRouterPorts,
                                                     std::string_view szBoxPorts);

}  // namespace tavo
