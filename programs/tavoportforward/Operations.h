// The operations file of a router model, read and checked: which requests make up a login, a listing, an
// added or deleted mapping. Relies on Pattern. Promises: a file with a word in it that this version does
// not know is refused, with the reason, rather than performed by half.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "ground/RouterScript.h"
#include "programs/tavoportforward/Pattern.h"
#include "programs/tavoportforward/WebClient.h"

namespace tavo {

// The steps, as their sections are named. Each is all sections of its name, in file order.
inline constexpr char kStepLogin[] = "login";
inline constexpr char kStepList[] = "PF list";
inline constexpr char kStepAddPort[] = "PF add port";
inline constexpr char kStepAddRange[] = "PF add range";
inline constexpr char kStepDeletePort[] = "PF delete port";
inline constexpr char kStepDeleteRange[] = "PF delete range";
inline constexpr char kStepApply[] = "apply";
inline constexpr char kStepLogout[] = "logout";

// One request of a step. Texts with placeholders are kept as they stand in the file.
struct Operation {
    std::string szStep;
    std::string szMethod = "GET";
    std::string szPath;
    std::optional<std::string> szBody;
    bool blJson = false;  // the body's kind; else a form
    std::vector<std::pair<std::string, std::string>> rgHeaders;
    std::vector<long> rgnStatus = {200};                   // answers that count as success
    std::vector<std::string> rgszExpect;                   // each must stand in the answer
    std::vector<std::string> rgszReject;                   // none of them may
    std::optional<std::string> szGone;                     // says that there was nothing to delete
    std::vector<std::pair<std::string, Pattern>> rgTakes;  // placeholder, and where its value stands
    std::optional<Pattern> entry;                          // one mapping of a listing
};

struct Operations {
    WebAuth enAuth = WebAuth::kNone;
    std::string szTcp = "tcp";  // the router's words
    std::string szUdp = "udp";
    std::string szBoth = "both";
    std::string szDefaultUser;  // of a router whose settings name no account
    std::string szDefaultPass;
    std::string szPrefix;     // begins the name of each mapping of ours
    size_t nNameLength = 60;  // longest name that the router keeps
    std::vector<Operation> rgOperations;

    bool Has(const std::string& szStep) const;
};

// Nothing, with szWhy set, for sections that cannot be performed.
std::optional<Operations> ReadOperations(const TAVO_PF_CONF* pSections, std::string& szWhy);

// The names between braces stand for values: "{user}". Where they go decides how a value is written, so
// that none can end the place that it stands in.
enum class Encoding { kUrl, kJson, kHeader };
using Values = std::map<std::string, std::string>;

// Nothing, with szWhy set to its name, when a placeholder has no value. Braces around anything but a plain
// name are just braces.
std::optional<std::string> FillIn(const std::string& szTemplate, const Values& values, Encoding enEncoding,
                                  std::string& szWhy);

}  // namespace tavo
