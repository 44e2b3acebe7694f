// What ports are for: names that a person says instead of numbers, and ports that should not face the world. Relies on
// /etc/services and on a handful of presets. Promises: a name stands for one protocol or for ports
// whose protocol is certain.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace tavo::cli {

// What "443", "5000-5010/udp", "https" or "minecraft" asks for.
struct PortWish {
    std::string szName = {};      // the preset or the service; empty for numbers
    std::string szPorts = {};     // as a rule writes them
    std::string szProtocol = {};  // "tcp", "udp", "all"; empty when only numbers were said
};

// Nothing when it is neither ports nor a known name.
std::optional<PortWish> ReadPortWish(const std::string& szText);
// The names of the presets, for a hint.
std::vector<std::string> PresetNames();

// Why this port of the box should not be open to everybody; empty for most.
std::string WhyRisky(int nPort);
// The same for a list of ports: one sentence a port.
std::vector<std::string> RisksOf(const std::vector<int>& rgPorts);

}  // namespace tavo::cli
