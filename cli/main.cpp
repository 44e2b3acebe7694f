// tavoportmap: the port-forwarding rules of this box and the router that they go to, for people and scripts.
// Relies on the library's public header; CLI11 reads the arguments, fmt and jsoncpp write the answers.
// Promises: one answer, also to wrong arguments; exit codes as in --help.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <exception>
#include <iterator>
#include <string_view>
#include <utility>

#include "Commands.h"
#include "Completions.h"
#include "Setup.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kFooter[] =
    "First steps:\n"
    "  sudo tavoportmap setup               find out how the router opens ports\n"
    "  sudo tavoportmap open 443 --to 8443  open port 443 of the router, for port 8443 of this box\n"
    "  tavoportmap status                   whether it is open, and if not, why\n\n"
    "Exit codes: 0 done; 1 failed; 2 wrong arguments; 3 another operation is running; 4 some ports were refused, are "
    "closed or not in force; 5 more rules than the router holds; 6 nothing is kept, because the router, the network or "
    "the daemon is away.\n\n"
    "With --json every answer, also to wrong arguments, is one JSON document on standard output: \"ok\", \"message\", "
    "\"warnings\" and what the command has to say. All of it: man tavoportmap\n";

// Under which head of the help a command stands; in the order of the heads, what a newcomer needs first.
constexpr std::pair<const char*, const char*> kGroups[] = {{"setup", "Ports"},
                                                           {"open", "Ports"},
                                                           {"close", "Ports"},
                                                           {"off", "Ports"},
                                                           {"on", "Ports"},
                                                           {"status", "Ports"},
                                                           {"test", "Ports"},
                                                           {"rules", "Rules in detail"},
                                                           {"save", "Rules in detail"},
                                                           {"service", "Rules in detail"},
                                                           {"router", "The router"},
                                                           {"routers", "The router"},
                                                           {"detect", "The router"},
                                                           {"compat", "The router"},
                                                           {"report", "The router"}};
constexpr char kOtherGroup[] = "For scripts and developers";

constexpr size_t kHelpColumn = 24;  // where the explanations of a help text begin

bool AsksForJson(int argc, char** argv) {
    for (int i = 1; i < argc && std::string_view(argv[i]) != "--"; ++i) {
        if (std::string_view(argv[i]) == "--json") {
            return true;
        }
    }
    return false;
}

void Group(CLI::App& app) {
    for (CLI::App* pCommand : app.get_subcommands([](const CLI::App*) { return true; })) {
        const auto pGroup = std::find_if(std::begin(kGroups), std::end(kGroups),
                                         [&](const auto& group) { return pCommand->get_name() == group.first; });
        pCommand->group(pGroup == std::end(kGroups) ? kOtherGroup : pGroup->second);
    }
}

// The help of the command that the arguments name.
Reply Help(const CLI::App& app) {
    Reply reply{.szBody = HelpText(app)};
    reply.jsAnswer["help"] = reply.szBody;
    return reply;
}

Reply Answer(int argc, char** argv, Request& request) {
    CLI::App app("Gets this box's ports through the router in front of it.", "tavoportmap");
    app.footer(kFooter);
    app.get_formatter()->column_width(kHelpColumn);
    app.require_subcommand(1);
    app.set_help_flag("-h,--help", "print this help");
    app.set_version_flag("--version", "tavoportmap " TAVO_VERSION, "print the version");
    app.add_flag("--json", request.blJson, "answer with one JSON document");
    OfferSetup(app, request);
    OfferOpen(app, request);
    OfferClose(app, request);
    OfferStatus(app, request);
    OfferTest(app, request);
    OfferRules(app, request);
    OfferSave(app, request);
    OfferService(app, request);
    OfferRouter(app, request);
    OfferRouters(app, request);
    OfferDetect(app, request);
    OfferCompat(app, request);
    OfferReport(app, request);
    OfferDiag(app, request);
    OfferCompletions(app, request);
    Group(app);
    try {
        app.parse(argc, argv);
    } catch (const CLI::CallForHelp&) {
        return Help(app);
    } catch (const CLI::CallForVersion& version) {
        return {.szMessage = version.what()};
    } catch (const CLI::ParseError& error) {
        return ExplainUsage(app, argc, argv, error);
    }
    return request.fnCommand();
}

// Whoever starts the tool without standard input, output or error gets /dev/null there: the next file opened, a lock or
// the rules, would stand in its place and get what is printed. And a reader that goes away ends no save in its midst.
void PrepareStreams() {
    int fd = -1;
    do {
        fd = open("/dev/null", O_RDWR);
    } while (fd >= 0 && fd <= STDERR_FILENO);
    close(fd);
    signal(SIGPIPE, SIG_IGN);
}

}  // namespace

CLI::App* AddCommand(CLI::App& app, const std::string& szName, const std::string& szWhat) {
    CLI::App* pCommand = app.add_subcommand(szName, szWhat);
    pCommand->fallthrough();
    return pCommand;
}

}  // namespace tavo::cli

int main(int argc, char** argv) {
    using namespace tavo::cli;
    PrepareStreams();
    Request request;
    request.blJson = AsksForJson(argc, argv);
    try {
        return Print(Answer(argc, argv, request), request.blJson);
    } catch (const std::exception& error) {
        return Print({.enExit = kFailed, .szMessage = Clean(error.what())}, request.blJson);
    }
}
