// tavo-netcheck: says in words what the checks of the network find, and how long each took.
// Relies on the platform's checks alone. Promises: changes nothing; 0 only when all of them passed.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>

#include "tavo/net.h"

namespace {

constexpr int kDefaultHops = 3;
constexpr int kMostHops = 30;
constexpr char kHelp[] =
    "Usage: tavo-netcheck [HOPS]\n"
    "Checks the interface, the gateway, the connection outside, the name servers and how many address\n"
    "translations stand in front of this box, for which it looks at HOPS routers (1 to 30, usually 3).\n"
    "The hosts and the name asked for stand in /etc/tavo/platform.conf, [network].\n";

// One check and its answer: whether it passed, and what there is to say.
struct Answer {
    bool blPassed;
    std::string szText;
};

bool Print(const char* szWhat, const std::function<Answer()>& fnCheck) {
    const auto start = std::chrono::steady_clock::now();
    const Answer answer = fnCheck();
    const std::chrono::duration<double> passed = std::chrono::steady_clock::now() - start;
    std::printf("%-10s %-4s %6.2f s  %s\n", szWhat, answer.blPassed ? "ok" : "FAIL", passed.count(),
                answer.szText.c_str());
    return answer.blPassed;
}

Answer Interface() {
    char szInterface[32] = {};
    if (checkGwIfEnable(szInterface, sizeof(szInterface)) == 0) {
        return {true, std::string(szInterface) + " is up and has an address"};
    }
    return {false, *szInterface == '\0' ? "there is no network interface"
                                        : std::string(szInterface) + " is down, unplugged or without an address"};
}

Answer Gateway() {
    char szGateway[32] = {};
    if (checkDefaultGatewaySetting(szGateway, sizeof(szGateway)) == 0) {
        return {true, std::string(szGateway) + " is the default gateway"};
    }
    return {false, *szGateway == '\0' ? "there is no default gateway"
                                      : std::string(szGateway) + " is in none of the networks of this box"};
}

Answer Level(int nHops) {
    int nLevel = 0;
    if (getPublicIPLevel(nLevel, nHops) != 0) {
        return {false, "neither the gateway nor the routers behind it tell how many translations there are"};
    }
    const std::string szLevel = std::to_string(nLevel);
    switch (nLevel) {
        case 0:
            return {true, szLevel + ": this box has a public address"};
        case 1:
            return {true, szLevel + ": only the home router translates addresses"};
        default:
            return {false, szLevel +
                               ": a second router or the provider translates addresses as well; ports opened in the "
                               "first one do not reach this box from outside"};
    }
}

}  // namespace

int main(int argc, char** argv) {
    const std::string szHops = argc > 1 ? argv[1] : "";
    const int nHops = argc == 1 ? kDefaultHops : std::atoi(szHops.c_str());
    if (argc > 2 || nHops < 1 || nHops > kMostHops) {
        std::fputs(kHelp, szHops == "--help" ? stdout : stderr);
        return szHops == "--help" ? 0 : 2;
    }
    bool blAll = Print("interface", Interface);
    blAll &= Print("gateway", Gateway);
    blAll &= Print("outside", [] {
        const bool blPassed = checkConnectToWAN() == 0;
        return Answer{blPassed, blPassed ? "a host outside answers" : "no host outside answers"};
    });
    blAll &= Print("level", [&] { return Level(nHops); });
    blAll &= Print("names", [] {
        const bool blPassed = checkDNSSetting() == 0;
        return Answer{blPassed, blPassed ? "the name servers answer" : "the name servers do not answer"};
    });
    return blAll ? 0 : 1;
}
