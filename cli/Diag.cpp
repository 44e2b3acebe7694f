// "diag": single steps of the relay service's port mapping, for developers. Relies on the library's diagnostic
// entry points. Promises: shows what they print, line by line, made harmless for a terminal.
#include <fmt/format.h>
#include <unistd.h>

#include <list>

#include "Box.h"
#include "Capture.h"
#include "Commands.h"
#include "RuleStore.h"

namespace tavo::cli {

namespace {

// Every line cleaned, the line breaks kept.
std::string CleanLines(std::string_view szText) {
    std::string szClean;
    while (!szText.empty()) {
        const size_t nEnd = std::min(szText.find('\n'), szText.size());
        szClean += Clean(szText.substr(0, nEnd)) + "\n";
        szText.remove_prefix(std::min(nEnd + 1, szText.size()));
    }
    return szClean;
}

// What an entry point printed and answered.
Reply Answered(int nResult, const std::string& szPrinted) {
    Reply reply{.szBody = CleanLines(szPrinted)};
    reply.jsAnswer["result"] = nResult;
    reply.jsAnswer["output"] = szPrinted;
    if (nResult < 0) {
        reply.enExit = kFailed;
        reply.szMessage = Failure(fmt::format("the library answered {}; the system log says why", nResult)).szMessage;
    }
    return reply;
}

Reply Caught(const std::function<int()>& fnEntry) {
    Capture output(STDOUT_FILENO);
    const int nResult = fnEntry();
    return Answered(nResult, output.Take());
}

Reply ParseText(std::string szText) {
    std::list<int> ports;
    const int nResult = TestFuncTLibParsePorts(ports, szText.data());
    return Answered(nResult, fmt::format("{}\n", fmt::join(ports, " ")));
}

Reply FormatNumbers(const std::string& szNumbers) {
    std::string szPrinted;
    char szPorts[TAVO_TEXT_SIZE] = {};
    Reply reply = Caught([&] {
        const int nResult = TestFuncToPorts(szPorts, sizeof(szPorts), szNumbers.c_str());
        if (nResult == 0) {
            fmt::print("{}\n", szPorts);
        }
        return nResult;
    });
    return reply;
}

Reply UsedPorts() {
    std::list<int> tcp, udp;
    const int nResult = TestFuncGetUsedRouterPortList(tcp, udp);
    return Answered(nResult, fmt::format("tcp: {}\nudp: {}\n", fmt::join(tcp, " "), fmt::join(udp, " ")));
}

void OfferText(CLI::App& diag, Request& request, const std::string& szName, const std::string& szArgument,
               const std::string& szExample, const std::string& szWhat,
               const std::function<Reply(const std::string&)>& fnAnswer) {
    const auto pText = std::make_shared<std::string>();
    CLI::App* pCommand = AddCommand(diag, szName, szWhat);
    pCommand->add_option(szArgument, *pText, "such as " + szExample)->required();
    pCommand->callback(
        [pText, fnAnswer, &request] { request.fnCommand = [pText, fnAnswer] { return fnAnswer(*pText); }; });
}

void OfferRequest(CLI::App& diag, Request& request, const std::string& szName, const std::string& szWhat,
                  int (*pfnEntry)(const char*)) {
    OfferText(diag, request, szName, "request", "'hoplink;5000-5001;tcp'", szWhat,
              [pfnEntry](const std::string& szText) { return Caught([&] { return pfnEntry(szText.c_str()); }); });
}

}  // namespace

void OfferDiag(CLI::App& app, Request& request) {
    CLI::App* pDiag = AddCommand(app, "diag", "single steps of the relay service's port mapping, for developers");
    pDiag->require_subcommand(1);
    pDiag->footer(
        "A request is a service's name and pairs of ports and protocol, nine at most:\n"
        "  tavoportmap diag conflicts 'hoplink;5000-5001;tcp;6000;udp'\n");
    OfferText(*pDiag, request, "parse-ports", "ports", "80,443,8000-8010", "the single ports of a text", &ParseText);
    OfferText(*pDiag, request, "to-ports", "numbers", "1,2,3,7", "numbers, ten at most, as a port list",
              &FormatNumbers);
    AddCommand(*pDiag, "rules", "the stored rules with their ports taken apart")->callback([&request] {
        request.fnCommand = [] {
            const auto obstacle = LoadRules() ? std::nullopt : NeedsRoot();
            return obstacle ? *obstacle : Caught(&TestFuncCreateOpRulesByRuleConf);
        };
    });
    AddCommand(*pDiag, "used-ports", "the ports that other hosts hold on the UPnP router")->callback([&request] {
        request.fnCommand = &UsedPorts;
    });
    OfferRequest(*pDiag, request, "conflicts", "what a request loses to other hosts on a UPnP router",
                 &TestFuncDeleteConflictPortsForUPnPRouter);
    OfferRequest(*pDiag, request, "test", "test a request's ports from outside; saves nothing", &TestFuncTestRules);
    OfferRequest(*pDiag, request, "set", "save a request to the router as the service would, and test it",
                 &TestFuncSetRules);
}

}  // namespace tavo::cli
