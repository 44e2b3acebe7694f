// Finds the first argument that has no meaning and the nearest one that has. Relies on CLI11's commands
// and options. Promises: see Usage.h.
#include "Usage.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <numeric>

#include "Table.h"

namespace tavo::cli {

namespace {

constexpr size_t kPageWidth = 80;  // of a help text that goes into a file, or a pager

enum class Kind { kNone, kCommand, kOption, kWord };

// How far the arguments make sense: the innermost command that they name, and the first that fits nothing.
struct Understood {
    const CLI::App* pApp;
    Kind enUnknown = Kind::kNone;
    std::string szUnknown = {};
};

const CLI::Option* FindOption(const CLI::App* pApp, const std::string& szName) {
    for (; pApp != nullptr; pApp = pApp->get_parent()) {
        if (const CLI::Option* pOption = pApp->get_option_no_throw(szName); pOption != nullptr) {
            return pOption;
        }
    }
    return nullptr;
}

std::vector<const CLI::App*> CommandsOf(const CLI::App& app) {
    return app.get_subcommands([](const CLI::App*) { return true; });
}

const CLI::App* FindCommand(const CLI::App& app, const std::string& szName) {
    const auto rgCommands = app.get_subcommands([&](const CLI::App* pApp) { return pApp->get_name() == szName; });
    return rgCommands.empty() ? nullptr : rgCommands.front();
}

size_t CountPositionals(const CLI::App& app) {
    const auto rgOptions = app.get_options([](const CLI::Option* pOption) { return pOption->get_positional(); });
    return rgOptions.size();
}

Understood Understand(const CLI::App& app, int argc, const char* const* argv) {
    Understood result{&app};
    size_t nWords = 0;
    for (int i = 1; i < argc && std::string_view(argv[i]) != "--"; ++i) {
        const std::string szWord = argv[i];
        if (szWord.size() > 1 && szWord[0] == '-') {
            const size_t nEqual = szWord.find('=');
            const CLI::Option* pOption = FindOption(result.pApp, szWord.substr(0, nEqual));
            if (pOption == nullptr) {
                return {result.pApp, Kind::kOption, szWord.substr(0, nEqual)};
            }
            i += nEqual == std::string::npos && pOption->get_items_expected_max() > 0 ? 1 : 0;
        } else if (const CLI::App* pCommand = FindCommand(*result.pApp, szWord); pCommand != nullptr) {
            result.pApp = pCommand;
        } else if (!CommandsOf(*result.pApp).empty()) {
            return {result.pApp, Kind::kCommand, szWord};
        } else if (++nWords > CountPositionals(*result.pApp)) {
            return {result.pApp, Kind::kWord, szWord};
        }
    }
    return result;
}

// "rules add"; empty for the tool itself.
std::string FullName(const CLI::App& app) {
    if (app.get_parent() == nullptr) {
        return "";
    }
    const std::string szAbove = FullName(*app.get_parent());
    return szAbove + (szAbove.empty() ? "" : " ") + app.get_name();
}

std::vector<std::string> CommandNames(const CLI::App& app) {
    std::vector<std::string> rgszNames;
    for (const CLI::App* pCommand : CommandsOf(app)) {
        if (!pCommand->get_group().empty()) {  // the others are for packaging
            rgszNames.push_back(pCommand->get_name());
        }
    }
    return rgszNames;
}

std::vector<std::string> OptionNames(const CLI::App& app) {
    std::vector<std::string> rgszNames;
    for (const CLI::App* pApp = &app; pApp != nullptr; pApp = pApp->get_parent()) {
        for (const CLI::Option* pOption : pApp->get_options()) {
            for (const std::string& szName : pOption->get_lnames()) {
                if (const std::string szLong = "--" + szName;
                    std::find(rgszNames.begin(), rgszNames.end(), szLong) == rgszNames.end()) {
                    rgszNames.push_back(szLong);
                }
            }
        }
    }
    return rgszNames;
}

// How many letters must be changed, added, left out or swapped to make one word of the other.
size_t Distance(const std::string& szOne, const std::string& szOther) {
    std::vector<std::vector<size_t>> rgSteps(szOne.size() + 1, std::vector<size_t>(szOther.size() + 1));
    for (size_t i = 0; i <= szOne.size(); ++i) {
        for (size_t j = 0; j <= szOther.size(); ++j) {
            size_t& nSteps = rgSteps[i][j];
            if (i == 0 || j == 0) {
                nSteps = i + j;
                continue;
            }
            const bool blSame = szOne[i - 1] == szOther[j - 1];
            nSteps =
                std::min({rgSteps[i - 1][j] + 1, rgSteps[i][j - 1] + 1, rgSteps[i - 1][j - 1] + (blSame ? 0U : 1U)});
            if (i > 1 && j > 1 && szOne[i - 1] == szOther[j - 2] && szOne[i - 2] == szOther[j - 1]) {
                nSteps = std::min(nSteps, rgSteps[i - 2][j - 2] + 1);
            }
        }
    }
    return rgSteps.back().back();
}

Reply Unknown(const std::string& szWhat, const std::string& szList, const std::string& szUnknown,
              const std::vector<std::string>& rgszKnown) {
    const std::string szNearest =
        szUnknown == "help" || szUnknown == "version" ? "--" + szUnknown : Nearest(szUnknown, rgszKnown);
    Reply reply{.enExit = kUsage,
                .szMessage = fmt::format("{}{}\n{}: {}", szWhat,
                                         szNearest.empty() ? "" : fmt::format("; did you mean '{}'?", szNearest),
                                         szList, Join(rgszKnown))};
    reply.jsAnswer["did_you_mean"] = szNearest.empty() ? Json::Value() : Json::Value(szNearest);
    reply.jsAnswer["expected"] = Json::arrayValue;
    for (const std::string& szWord : rgszKnown) {
        reply.jsAnswer["expected"].append(szWord);
    }
    return reply;
}

Reply MissingCommand(const CLI::App& app) {
    const std::string szName = FullName(app);
    const std::string szHelp = HelpText(app);
    Reply reply{.enExit = kUsage,
                .szMessage = fmt::format("{} needs a command: {}", szName.empty() ? "tavoportmap" : "'" + szName + "'",
                                         Join(CommandNames(app))),
                .szBody = szHelp};
    reply.jsAnswer["help"] = szHelp;
    for (const std::string& szWord : CommandNames(app)) {
        reply.jsAnswer["expected"].append(szWord);
    }
    return reply;
}

}  // namespace

std::string HelpText(const CLI::App& app) {
    const size_t nWidth = WidthOf(STDOUT_FILENO);
    return Wrap(app.help(app.get_parent() == nullptr ? "" : "tavoportmap"), nWidth == 0 ? kPageWidth : nWidth);
}

Reply ExplainUsage(const CLI::App& app, int argc, const char* const* argv, const CLI::ParseError& error) {
    const Understood understood = Understand(app, argc, argv);
    const CLI::App& command = *understood.pApp;
    const std::string szName = FullName(command);
    const std::string szUnknown = Clean(understood.szUnknown);
    const std::string szHelp = fmt::format("'tavoportmap {}{}--help' explains", szName, szName.empty() ? "" : " ");
    switch (understood.enUnknown) {
        case Kind::kCommand:
            return Unknown(fmt::format("there is no command '{}{}{}'", szName, szName.empty() ? "" : " ", szUnknown),
                           "the commands are", understood.szUnknown, CommandNames(command));
        case Kind::kOption:
            return Unknown(fmt::format("there is no option '{}'{}", szUnknown,
                                       szName.empty() ? "" : fmt::format(" for '{}'", szName)),
                           "the options are", understood.szUnknown, OptionNames(command));
        case Kind::kWord:
            return {.enExit = kUsage,
                    .szMessage = fmt::format("'{}' is one word too many for '{}'\n{}", szUnknown, szName, szHelp)};
        default:
            if (!CommandsOf(command).empty()) {
                return MissingCommand(command);
            }
            return {.enExit = kUsage, .szMessage = fmt::format("{}: {}\n{}", szName, Clean(error.what()), szHelp)};
    }
}

std::string Nearest(const std::string& szWord, const std::vector<std::string>& rgszWords) {
    constexpr size_t kLongestWord = 64;
    const std::string* pNearest = nullptr;
    size_t nNearest = kLongestWord;
    for (const std::string& szKnown : rgszWords) {
        // A word that was cut short is as good as one letter wrong.
        const bool blPrefix = szWord.size() > 2 && szKnown.starts_with(szWord);
        const size_t nDistance = blPrefix ? 1 : szWord.size() > kLongestWord ? nNearest : Distance(szWord, szKnown);
        if (nDistance < nNearest && nDistance <= std::max<size_t>(1, szKnown.size() / 3)) {
            pNearest = &szKnown;
            nNearest = nDistance;
        }
    }
    return pNearest == nullptr ? "" : *pNearest;
}

std::string Join(const std::vector<std::string>& rgszWords) {
    return fmt::format("{}", fmt::join(rgszWords, ", "));
}

CLI::Validator OneOf(std::vector<std::string> rgszWords) {
    return CLI::Validator(
        [rgszWords = std::move(rgszWords)](std::string& szWord) -> std::string {
            if (std::find(rgszWords.begin(), rgszWords.end(), szWord) != rgszWords.end()) {
                return "";
            }
            const std::string szNearest = Nearest(szWord, rgszWords);
            return fmt::format("'{}' is none of {}{}", szWord, Join(rgszWords),
                               szNearest.empty() ? "" : fmt::format("; did you mean '{}'?", szNearest));
        },
        "");
}

CLI::Validator NumberBetween(int nFirst, int nLast) {
    return CLI::Validator(
        [=](std::string& szText) -> std::string {
            int nNumber = 0;
            const char* pEnd = szText.data() + szText.size();
            const auto [pRead, error] = std::from_chars(szText.data(), pEnd, nNumber);
            const bool blGood = error == std::errc() && pRead == pEnd && nNumber >= nFirst && nNumber <= nLast;
            return blGood ? "" : fmt::format("'{}' is no whole number from {} to {}", szText, nFirst, nLast);
        },
        "");
}

}  // namespace tavo::cli
