// JSON that somebody else may have written. Relies on jsoncpp. Promises: a text that is no document, names a member
// twice or goes deeper than any of ours is a fault with words, never an exception.
#pragma once

#include <json/json.h>

#include <optional>
#include <string>

namespace tavo::cli {

// The object or array that szText is; else nothing, and why, with words of the text in it.
std::optional<Json::Value> ReadJson(const std::string& szText, std::string* pszFault = nullptr);

}  // namespace tavo::cli
