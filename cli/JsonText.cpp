// Reads JSON strictly. Relies on jsoncpp, which throws where a text goes too deep. Promises: see JsonText.h.
#include "JsonText.h"

#include <algorithm>
#include <memory>

namespace tavo::cli {

namespace {

constexpr int kMostDepth = 64;

}  // namespace

std::optional<Json::Value> ReadJson(const std::string& szText, std::string* pszFault) {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["stackLimit"] = kMostDepth;
    const std::unique_ptr<Json::CharReader> pReader(builder.newCharReader());
    Json::Value js;
    std::string szErrors;
    try {
        if (pReader->parse(szText.data(), szText.data() + szText.size(), &js, &szErrors)) {
            return js;
        }
        // "* Line 1, Column 2\n  Missing '}' or object member name\n", once for each fault
        szErrors = szErrors.substr(0, szErrors.find("\n*"));
        std::erase(szErrors, '*');
        std::erase(szErrors, '\n');
    } catch (const Json::Exception&) {
        szErrors = "it is nested too deeply";
    }
    if (pszFault != nullptr) {
        *pszFault = szErrors.substr(std::min(szErrors.find_first_not_of(' '), szErrors.size()));
    }
    return std::nullopt;
}

}  // namespace tavo::cli
