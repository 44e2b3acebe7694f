// tavoportmap: the port-forwarding rules of this box and the router that they go to, for people and scripts.
// Relies on the library's public header; CLI11 reads the arguments, fmt and jsoncpp write the answers.
// Promises: one answer, also to wrong arguments; exit codes as in --help.
#include <exception>
#include <string_view>

#include "Commands.h"
#include "Setup.h"
#include "Completions.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kFooter[] =
    "First steps:\n"
    "  tavoportmap setup              find out what the router is and remember it\n"
    "  tavoportmap rules add web --router-port 443 --box-port 8443\n"
    "  tavoportmap save               write the rules to the router\n\n"
    "Exit codes: 0 done, 1 failed, 2 wrong arguments, 3 another operation is running,\n"
    "4 some ports were refused or are closed, 5 more rules than the router holds.\n\n"
    "With --json every answer, also to wrong arguments, is one JSON document on\n"
    "standard output: \"ok\", \"message\", \"warnings\" and what the command has to say.\n"
    "Files, the meaning of each status and what to do: man tavoportmap\n";

constexpr size_t kHelpColumn = 24;  // where the explanations of a help text begin

bool AsksForJson(int argc, char** argv) {
    for (int i = 1; i < argc && std::string_view(argv[i]) != "--"; ++i) {
        if (std::string_view(argv[i]) == "--json") {
            return true;
        }
    }
    return false;
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
    OfferDetect(app, request);
    OfferRouter(app, request);
    OfferRouters(app, request);
    OfferRules(app, request);
    OfferSave(app, request);
    OfferTest(app, request);
    OfferStatus(app, request);
    OfferCompat(app, request);
    OfferReport(app, request);
    OfferService(app, request);
    OfferDiag(app, request);
    OfferCompletions(app, request);
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

}  // namespace

CLI::App* AddCommand(CLI::App& app, const std::string& szName, const std::string& szWhat) {
    CLI::App* pCommand = app.add_subcommand(szName, szWhat);
    pCommand->fallthrough();
    return pCommand;
}

}  // namespace tavo::cli

int main(int argc, char** argv) {
    using namespace tavo::cli;
    Request request;
    request.blJson = AsksForJson(argc, argv);
    try {
        return Print(Answer(argc, argv, request), request.blJson);
    } catch (const std::exception& error) {
        return Print({.enExit = kFailed, .szMessage = Clean(error.what())}, request.blJson);
    }
}
