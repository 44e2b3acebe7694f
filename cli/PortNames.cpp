// Names and risks of ports. Relies on /etc/services. Promises: see PortNames.h.
#include "PortNames.h"

#include <fmt/format.h>

#include <algorithm>
#include <charconv>
#include <fstream>
#include <sstream>

#include "RuleStore.h"

namespace tavo::cli {

namespace {

struct Preset {
    const char* szName;
    const char* szPorts;
    const char* szProtocol;
};

// What people serve at home under names that /etc/services does not have, or has with too many protocols.
constexpr Preset kPresets[] = {
    {"web", "80,443", "tcp"},
    {"http", "80", "tcp"},
    {"https", "443", "tcp"},
    {"ssh", "22", "tcp"},
    {"wireguard", "51820", "udp"},
    {"openvpn", "1194", "udp"},
    {"minecraft", "25565", "tcp"},
    {"mumble", "64738", "all"},
    {"teamspeak", "9987", "udp"},
    {"plex", "32400", "tcp"},
    {"jellyfin", "8096", "tcp"},
    {"home-assistant", "8123", "tcp"},
    {"bittorrent", "6881-6889", "all"},
    {"mqtts", "8883", "tcp"},
    {"imaps", "993", "tcp"},
};

struct Risk {
    int nPort;
    const char* szWhy;
};

constexpr char kDatabase[] = "a database listens there; everybody outside could try its passwords and its faults";
constexpr char kDesktop[] = "a desktop is served there, which is attacked all day; a VPN (wireguard) is the safer way";

constexpr Risk kRisks[] = {
    {21, "FTP sends passwords as plain text; use SFTP (ssh)"},
    {22, "ssh is tried with guessed passwords all day: allow only keys ('PasswordAuthentication no')"},
    {23, "telnet sends everything, passwords too, as plain text; use ssh"},
    {25, "a mail server that relays for strangers is used for spam within hours"},
    {53, "a name server that answers everybody is used to attack others"},
    {111, "the port mapper tells strangers what else runs here, and is used to attack others"},
    {139, "Windows file sharing is for home networks only; use a VPN (wireguard)"},
    {445, "Windows file sharing is for home networks only, and is what worms look for; use a VPN (wireguard)"},
    {548, "file sharing is for home networks only; use a VPN (wireguard)"},
    {631, "a printer that strangers reach prints what strangers like"},
    {1433, kDatabase},
    {1900, "UPnP discovery is for home networks only, and is used to attack others"},
    {2049, "NFS trusts whoever says that he is somebody; use a VPN (wireguard)"},
    {2375, "whoever reaches this port of Docker is root on this box"},
    {3306, kDatabase},
    {3389, kDesktop},
    {5432, kDatabase},
    {5900, kDesktop},
    {5984, kDatabase},
    {6379, kDatabase},
    {9200, kDatabase},
    {11211, "memcached answers everybody without a password, and is used to attack others"},
    {27017, kDatabase},
};

std::optional<PortWish> ReadPreset(const std::string& szName) {
    const auto pPreset =
        std::find_if(std::begin(kPresets), std::end(kPresets), [&](const Preset& p) { return szName == p.szName; });
    return pPreset == std::end(kPresets)
               ? std::nullopt
               : std::optional(PortWish{pPreset->szName, pPreset->szPorts, pPreset->szProtocol});
}

// The port of a line "name port/protocol aliases # remark" that is about this name and protocol. The system's own
// reader (getservbyname) makes 4464 of 70000, a port that nobody has named: so the line is read here, and is none.
std::optional<int> PortIn(const std::string& szLine, const std::string& szName, const std::string& szProtocol) {
    std::istringstream words(szLine.substr(0, szLine.find('#')));
    std::string szWord, szPort;
    words >> szWord >> szPort;
    bool blNamed = szWord == szName;
    while (words >> szWord) {
        blNamed = blNamed || szWord == szName;
    }
    int nPort = 0;
    const auto [pRead, fault] = std::from_chars(szPort.data(), szPort.data() + szPort.size(), nPort);
    const bool blPort = fault == std::errc() && nPort >= 1 && nPort <= UINT16_MAX;
    return blNamed && blPort && pRead == "/" + szProtocol ? std::optional(nPort) : std::nullopt;
}

// A name that has both protocols in /etc/services is meant as TCP, unless UDP is said: nearly all of them have
// only been registered for both.
std::optional<PortWish> ReadService(const std::string& szName, const std::string& szProtocol) {
    for (const std::string& szTried :
         szProtocol.empty() ? std::vector<std::string>{"tcp", "udp"} : std::vector<std::string>{szProtocol}) {
        std::ifstream services("/etc/services");
        for (std::string szLine; std::getline(services, szLine);) {
            if (const auto nPort = PortIn(szLine, szName, szTried)) {
                return PortWish{szName, std::to_string(*nPort), szTried};
            }
        }
    }
    return std::nullopt;
}

}  // namespace

std::optional<PortWish> ReadPortWish(const std::string& szText) {
    const size_t nSlash = szText.rfind('/');
    const std::string szWhat = szText.substr(0, nSlash);
    const std::string szProtocol = nSlash == std::string::npos ? "" : szText.substr(nSlash + 1);
    if (szWhat.empty() ||
        (nSlash != std::string::npos && szProtocol != "tcp" && szProtocol != "udp" && szProtocol != "all")) {
        return std::nullopt;
    }
    if (ParsePorts(szWhat)) {
        return PortWish{"", szWhat, szProtocol};
    }
    auto wish = ReadPreset(szWhat);
    if (wish && !szProtocol.empty()) {
        wish->szProtocol = szProtocol;
    }
    return wish ? wish : ReadService(szWhat, szProtocol);
}

std::vector<std::string> PresetNames() {
    std::vector<std::string> rgszNames;
    for (const Preset& preset : kPresets) {
        rgszNames.emplace_back(preset.szName);
    }
    return rgszNames;
}

std::string WhyRisky(int nPort) {
    const auto pRisk =
        std::find_if(std::begin(kRisks), std::end(kRisks), [nPort](const Risk& risk) { return risk.nPort == nPort; });
    return pRisk == std::end(kRisks) ? "" : pRisk->szWhy;
}

std::vector<std::string> RisksOf(const std::vector<int>& rgPorts) {
    std::vector<std::string> rgszRisks;
    for (const int nPort : rgPorts) {
        if (const std::string szWhy = WhyRisky(nPort); !szWhy.empty()) {
            rgszRisks.push_back(fmt::format("port {}: {}", nPort, szWhy));
        }
    }
    return rgszRisks;
}

}  // namespace tavo::cli
