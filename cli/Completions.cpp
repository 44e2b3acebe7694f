// Writes completions for bash, zsh and fish. Relies on CLI11's tree of commands. Promises: see Completions.h.
#include "Completions.h"

#include <fmt/format.h>

#include <algorithm>
#include <memory>

#include "Usage.h"

namespace tavo::cli {

namespace {

// A word that may come next: a command or an option.
struct Word {
    std::string szText;
    std::string szWhat;
    bool blValue = false;  // an option that takes one
};

// What may follow the commands of a path: "" for the tool itself, " rules add".
struct Place {
    std::string szPath;
    std::vector<Word> rgWords;
};

std::string FirstLine(const std::string& szText) {
    return szText.substr(0, szText.find('\n'));
}

// For the inside of single quotes. A quotation mark is written in another way by each shell.
std::string Quoted(const std::string& szText, std::string_view szMark) {
    std::string szQuoted;
    for (const char c : szText) {
        szQuoted += c == '\'' ? std::string(szMark) : std::string(1, c);
    }
    return szQuoted;
}

void Collect(const CLI::App& app, const std::string& szPath, std::vector<Place>& rgPlaces) {
    Place place{szPath, {}};
    std::vector<const CLI::App*> rgShown =
        app.get_subcommands([](const CLI::App* pApp) { return !pApp->get_group().empty(); });
    for (const CLI::App* pCommand : rgShown) {
        place.rgWords.push_back({pCommand->get_name(), FirstLine(pCommand->get_description())});
    }
    for (const CLI::App* pApp = &app; pApp != nullptr; pApp = pApp->get_parent()) {
        for (const CLI::Option* pOption : pApp->get_options()) {
            for (const std::string& szName : pOption->get_lnames()) {
                place.rgWords.push_back(
                    {"--" + szName, FirstLine(pOption->get_description()), pOption->get_items_expected_max() > 0});
            }
        }
    }
    std::stable_sort(place.rgWords.begin(), place.rgWords.end(),
                     [](const Word& one, const Word& other) { return one.szText < other.szText; });
    const auto end = std::unique(place.rgWords.begin(), place.rgWords.end(),
                                 [](const Word& one, const Word& other) { return one.szText == other.szText; });
    place.rgWords.erase(end, place.rgWords.end());
    rgPlaces.push_back(std::move(place));
    for (const CLI::App* pCommand : rgShown) {
        Collect(*pCommand, szPath + " " + pCommand->get_name(), rgPlaces);
    }
}

// Both shells walk the words before the cursor: those that lead to a known place are commands.
constexpr char kBash[] = R"(# bash completion of tavoportmap
_tavoportmap() {{
    local -A rgWords=(
{0}    )
    local -A rgValues=(
{1}    )
    local szPlace="" nWord
    for ((nWord = 1; nWord < COMP_CWORD; nWord++)); do
        [ -z "${{rgWords[.$szPlace ${{COMP_WORDS[nWord]}}]+x}}" ] || szPlace+=" ${{COMP_WORDS[nWord]}}"
    done
    COMPREPLY=()
    [ -z "${{rgValues[${{COMP_WORDS[COMP_CWORD - 1]}}]+x}}" ] || return 0
    mapfile -t COMPREPLY < <(compgen -W "${{rgWords[.$szPlace]}}" -- "${{COMP_WORDS[COMP_CWORD]}}")
}}
complete -o default -F _tavoportmap tavoportmap
)";

constexpr char kZsh[] = R"(#compdef tavoportmap
# zsh completion of tavoportmap
_tavoportmap() {{
    local -A rgPlaces=(
{0}    )
    local -A rgValues=(
{1}    )
    local szPlace=. szWord
    local -a rgChoices
    for szWord in "${{(@)words[2,CURRENT-1]}}"; do
        [[ -z ${{rgPlaces[$szPlace $szWord]}} ]] || szPlace+=" $szWord"
    done
    if [[ -n ${{rgValues[${{words[CURRENT-1]}}]}} ]]; then
        _files
        return
    fi
    rgChoices=("${{(@f)${{rgPlaces[$szPlace]}}}}")
    _describe tavoportmap rgChoices
}}
_tavoportmap "$@"
)";

constexpr char kFish[] = R"(# fish completion of tavoportmap
function __tavoportmap_at
    set -l szPlace .
    for szWord in (commandline -opc)[2..-1]
        contains -- "$szPlace $szWord" $__tavoportmap_places; and set szPlace "$szPlace $szWord"
    end
    test "$szPlace" = "$argv[1]"
end
set -g __tavoportmap_places {0}
complete -c tavoportmap -f
{1})";

std::string Values(const std::vector<Place>& rgPlaces, const char* szFormat) {
    std::vector<std::string> rgszValues;
    for (const Place& place : rgPlaces) {
        for (const Word& word : place.rgWords) {
            if (word.blValue && std::find(rgszValues.begin(), rgszValues.end(), word.szText) == rgszValues.end()) {
                rgszValues.push_back(word.szText);
            }
        }
    }
    std::string szLines;
    for (const std::string& szValue : rgszValues) {
        szLines += fmt::format(fmt::runtime(szFormat), szValue);
    }
    return szLines;
}

std::string ForBash(const std::vector<Place>& rgPlaces) {
    std::string szLines;
    for (const Place& place : rgPlaces) {
        szLines += fmt::format("        ['.{}']='", place.szPath);
        for (const Word& word : place.rgWords) {
            szLines += word.szText + " ";
        }
        szLines += "'\n";
    }
    return fmt::format(kBash, szLines, Values(rgPlaces, "        ['{}']=1\n"));
}

std::string ForZsh(const std::vector<Place>& rgPlaces) {
    std::string szLines;
    for (const Place& place : rgPlaces) {
        std::string szWords;
        for (const Word& word : place.rgWords) {
            szWords += fmt::format("{}{}:{}", szWords.empty() ? "" : "\n", word.szText, word.szWhat);
        }
        szLines += fmt::format("        '.{}' '{}'\n", place.szPath, Quoted(szWords, R"('\'')"));
    }
    return fmt::format(kZsh, szLines, Values(rgPlaces, "        '{}' 1\n"));
}

std::string ForFish(const std::vector<Place>& rgPlaces) {
    std::string szNames;
    std::string szLines;
    for (const Place& place : rgPlaces) {
        szNames += fmt::format(" '.{}'", place.szPath);
        for (const Word& word : place.rgWords) {
            const bool blOption = word.szText.starts_with("--");
            szLines += fmt::format("complete -c tavoportmap -n \"__tavoportmap_at '.{}'\" {} {}{} -d '{}'\n",
                                   place.szPath, blOption ? "-l" : "-a", blOption ? word.szText.substr(2) : word.szText,
                                   word.blValue ? " -r -F" : "", Quoted(word.szWhat, R"(\')"));
        }
    }
    return fmt::format(kFish, szNames, szLines);
}

Reply Completions(const CLI::App& app, const std::string& szShell) {
    std::vector<Place> rgPlaces;
    Collect(app, "", rgPlaces);
    const std::string szScript = szShell == "bash"  ? ForBash(rgPlaces)
                                 : szShell == "zsh" ? ForZsh(rgPlaces)
                                                    : ForFish(rgPlaces);
    Reply reply{.szBody = szScript};
    reply.jsAnswer["script"] = szScript;
    return reply;
}

}  // namespace

void OfferCompletions(CLI::App& app, Request& request) {
    CLI::App* pCommand = AddCommand(app, "completions", "print the completions for a shell: bash, zsh or fish");
    pCommand->group("");
    const auto pShell = std::make_shared<std::string>();
    pCommand->add_option("shell", *pShell, "bash, zsh or fish")->required()->check(OneOf({"bash", "zsh", "fish"}));
    pCommand->callback(
        [&app, &request, pShell] { request.fnCommand = [&app, pShell] { return Completions(app, *pShell); }; });
}

}  // namespace tavo::cli
