// Chooses among the listeners and shows them. Relies on the kernel's range of ports for programs that only ask.
// Promises: see Offer.h.
#include "Offer.h"

#include <arpa/inet.h>
#include <fmt/format.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <sstream>

#include "Ask.h"
#include "Listeners.h"
#include "Open.h"
#include "PortNames.h"
#include "RuleStore.h"
#include "Table.h"
#include "tavo/net.h"

namespace tavo::cli {

namespace {

// Of use on the home network alone: addresses, names, times and the search for devices; and our own daemons' ports.
constexpr uint16_t kHomePorts[] = {67, 68, 69, 123, 137, 138, 546, 547, 1900, 3702, 5350, 5351, 5353, 5355};

struct Range {
    unsigned nFirst = 32768;
    unsigned nLast = 60999;
};

// The ports that the kernel gives to programs which only want an answer.
Range BorrowedPorts() {
    Range range;
    std::ifstream("/proc/sys/net/ipv4/ip_local_port_range") >> range.nFirst >> range.nLast;
    return range;
}

std::string OwnAddress(const std::string& szGateway) {
    char szLocal[INET_ADDRSTRLEN] = {};
    return TAVONetLocalAddressGet(szGateway.c_str(), szLocal, sizeof(szLocal), nullptr, 0) == 0 ? szLocal : "";
}

bool IsForwarded(const Rules& rules, const Listener& listener) {
    return std::any_of(rules.begin(), rules.end(), [&](const Rule& rule) {
        const auto rgPorts = ParsePorts(rule.szBoxPorts);
        return rule.blEnabled && (rule.szProtocol == listener.szProtocol || rule.szProtocol == "all") && rgPorts &&
               std::find(rgPorts->begin(), rgPorts->end(), listener.nPort) != rgPorts->end();
    });
}

// What somebody outside could want to reach.
std::vector<Listener> Candidates(const std::string& szGateway) {
    const std::string szOwn = OwnAddress(szGateway);
    const Range borrowed = BorrowedPorts();
    const Rules rules = LoadRules().value_or(Rules());
    std::vector<Listener> rgFound;
    for (const Listener& listener : ReadListeners()) {
        const bool blReachable = listener.szAddress == "0.0.0.0" || listener.szAddress == "::" ||
                                 listener.szAddress == szOwn || listener.szAddress == "::ffff:" + szOwn;
        const bool blHome =
            std::find(std::begin(kHomePorts), std::end(kHomePorts), listener.nPort) != std::end(kHomePorts);
        // The kernel's own sockets, such as WireGuard's, have no program.
        const bool blAsksOnly = listener.szProtocol == "udp" && !listener.szProgram.empty() && !listener.blContainer &&
                                listener.nPort >= borrowed.nFirst && listener.nPort <= borrowed.nLast;
        const bool blTwice = std::any_of(rgFound.begin(), rgFound.end(), [&](const Listener& found) {
            return found.nPort == listener.nPort && found.szProtocol == listener.szProtocol;
        });
        if (blReachable && !listener.blLoopbackOnly && !blHome && !blAsksOnly && !blTwice &&
            !IsForwarded(rules, listener)) {
            rgFound.push_back(listener);
        }
    }
    return rgFound;
}

std::string NameOf(const Listener& listener) {
    return fmt::format("{}{}", listener.nPort, listener.szProtocol == "udp" ? "/udp" : "");
}

std::string WhoListens(const Listener& listener) {
    return listener.szProgram.empty() ? (listener.blContainer ? "a container" : "the system")
                                      : Clean(listener.szProgram);
}

Json::Value ToJson(const Listener& listener, const std::string& szRisk) {
    Json::Value js;
    js["port"] = listener.nPort;
    js["protocol"] = listener.szProtocol;
    js["program"] = listener.szProgram.empty() ? Json::Value() : Json::Value(listener.szProgram);
    js["container"] = listener.blContainer;
    js["risk"] = szRisk.empty() ? Json::Value() : Json::Value(szRisk);
    return js;
}

// The ports in the answer to the question; each is opened as by 'open', which asks back where that is risky.
void OpenChosen(const std::string& szChosen, Reply& reply) {
    std::istringstream words(szChosen);
    std::vector<std::string> rgszWords{std::istream_iterator<std::string>(words), {}};
    if (rgszWords.size() == 1 && (rgszWords[0] == "n" || rgszWords[0] == "no" || rgszWords[0] == "none")) {
        return;  // as to a question of yes or no, which came before it
    }
    for (std::string& szWord : rgszWords) {
        while (szWord.ends_with(',')) {
            szWord.pop_back();
        }
        if (szWord.empty()) {
            continue;
        }
        const Reply opened = OpenPort(szWord, false);
        reply.szMessage += (reply.szMessage.empty() ? "" : "\n") + szWord + ": " + opened.szMessage;
        reply.rgszWarnings.insert(reply.rgszWarnings.end(), opened.rgszWarnings.begin(), opened.rgszWarnings.end());
        reply.enExit = opened.enExit == kOk ? reply.enExit : opened.enExit;
    }
}

}  // namespace

void OfferListeners(const std::string& szGateway, bool blAsk, Reply& reply) {
    const std::vector<Listener> rgFound = Candidates(szGateway);
    reply.jsAnswer["could_be_opened"] = Json::arrayValue;
    Table table({"port", "program", "remark"});
    std::string szSafe;
    for (const Listener& listener : rgFound) {
        const std::string szRisk = WhyRisky(listener.nPort);
        reply.jsAnswer["could_be_opened"].append(ToJson(listener, szRisk));
        table.Add({NameOf(listener), WhoListens(listener), szRisk.empty() ? "" : "better not: " + szRisk});
        szSafe = szSafe.empty() && szRisk.empty() ? NameOf(listener) : szSafe;
    }
    const bool blOff = IsOff();
    if (blOff) {
        reply.szMessage += "\nevery port is switched off; 'sudo tavoportmap on' comes before opening another one";
    }
    if (rgFound.empty() && blOff) {
        return;
    }
    if (rgFound.empty()) {
        reply.szMessage +=
            "\nno program here waits for connections that is not forwarded yet; 'sudo tavoportmap open PORT' "
            "opens a port for one that is still to come";
        return;
    }
    reply.szBody += "\nlistens on this box and is not forwarded:\n" + table.ToText();
    if (blOff) {
        return;
    }
    if (!blAsk) {
        reply.szMessage += fmt::format("\n'sudo tavoportmap open {}' opens {}", szSafe.empty() ? "PORT" : szSafe,
                                       szSafe.empty() ? "a port" : "the first of them that is fit for it");
        return;
    }
    // A question needs the result before it; whoever is asked has seen it then.
    Print(reply, false);
    reply.szBody.clear();
    reply.szMessage.clear();
    reply.rgszWarnings.clear();
    OpenChosen(AskLine("Which of them are to be opened to everybody outside (such as 443 51820/udp; Enter: none)? "),
               reply);
}

}  // namespace tavo::cli
