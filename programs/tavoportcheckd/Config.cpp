// Reads portcheck.conf. Relies on TLIBCFileGetSectionValue. Promises: see Config.h.
#include "programs/tavoportcheckd/Config.h"

#include <sys/stat.h>

#include <algorithm>
#include <charconv>
#include <sstream>

#include "tavo/core.h"

namespace tavo {

namespace {

constexpr char kSection[] = "portcheck";
constexpr char kDefaultListen[] = "0.0.0.0:8099 [::]:8099";
constexpr char kDefaultProxyHeader[] = "X-Forwarded-For";
constexpr size_t kMinToken = 16;
constexpr size_t kMaxToken = 256;

class Source {
public:
    explicit Source(std::string szPath) : mSzPath(std::move(szPath)) {}

    std::string Text(const char* szKey, const char* szDefault) const {
        char szValue[1024];
        const bool blFound = TLIBCFileGetSectionValue(mSzPath.c_str(), kSection, szKey, szValue, sizeof(szValue)) == 0;
        return blFound ? szValue : szDefault;
    }
    std::vector<std::string> Words(const char* szKey, const char* szDefault) const {
        std::istringstream text(Text(szKey, szDefault));
        std::vector<std::string> rgszWords;
        for (std::string szWord; text >> szWord;) {
            rgszWords.push_back(szWord);
        }
        return rgszWords;
    }
    bool Number(const char* szKey, int nDefault, int nMost, int& nValue) const {
        const std::string szText = Text(szKey, std::to_string(nDefault).c_str());
        const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
        return error == std::errc() && pEnd == szText.data() + szText.size() && nValue >= 1 && nValue <= nMost;
    }

private:
    std::string mSzPath;
};

// "0.0.0.0:8099" or "[::]:8099".
bool ParseListen(const std::string& szText, std::vector<sockaddr_storage>& rgListen) {
    const size_t nColon = szText.rfind(':');
    uint16_t nPort = 0;
    if (nColon == std::string::npos || nColon < 2) {
        return false;
    }
    const char* pEnd = szText.data() + szText.size();
    const auto number = std::from_chars(szText.data() + nColon + 1, pEnd, nPort);
    const bool blV6 = szText.front() == '[' && szText[nColon - 1] == ']';
    const auto address = Address::Parse(blV6 ? szText.substr(1, nColon - 2) : szText.substr(0, nColon));
    if (number.ec != std::errc() || number.ptr != pEnd || nPort == 0 || !address ||
        (address->Family() == AF_INET6) != blV6) {
        return false;
    }
    rgListen.push_back(address->WithPort(nPort));
    return true;
}

bool IsToken(const std::string& szToken) {
    return szToken.size() >= kMinToken && szToken.size() <= kMaxToken &&
           std::all_of(szToken.begin(), szToken.end(), [](unsigned char c) { return c > ' ' && c <= '~'; });
}

}  // namespace

bool ReadConfig(const std::string& szPath, CheckdConfig& config, std::string& szReason) {
    struct stat status = {};
    if (stat(szPath.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
        szReason = "it cannot be read";
        return false;
    }
    if ((status.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
        szReason = "it holds the token and can be read by other users; make its mode 0600";
        return false;
    }
    const Source source(szPath);
    config.szToken = source.Text("token", "");
    config.szProxyHeader = source.Text("proxy_header", kDefaultProxyHeader);
    for (const std::string& szListen : source.Words("listen", kDefaultListen)) {
        if (!ParseListen(szListen, config.rgListen)) {
            szReason = "listen: \"" + szListen + "\" is no \"address:port\"";
            return false;
        }
    }
    for (const std::string& szProxy : source.Words("trusted_proxies", "")) {
        const auto address = Address::Parse(szProxy);
        if (!address) {
            szReason = "trusted_proxies: \"" + szProxy + "\" is no address";
            return false;
        }
        config.rgTrustedProxies.push_back(*address);
    }
    if (!IsToken(config.szToken)) {
        szReason = "token: 16 to 256 characters without blanks are needed";
        return false;
    }
    if (!source.Number("per_address", 12, 1000, config.nPerAddress) ||
        !source.Number("total", 120, 10000, config.nTotal) || !source.Number("at_once", 8, 32, config.nAtOnce) ||
        !source.Number("max_ports", 64, 256, config.nMaxPorts)) {
        szReason = "per_address, total, at_once or max_ports is no number in its bounds";
        return false;
    }
    return true;
}

}  // namespace tavo
