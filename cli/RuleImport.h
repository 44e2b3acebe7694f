// Rules from outside, and rules chosen by a word. Relies on jsoncpp. Promises: a document is taken whole or not at
// all, and a word that could mean two rules means none.
#pragma once

#include <optional>
#include <string>

#include "RuleStore.h"

namespace tavo::cli {

// What is wrong with a rule that somebody asks for; empty when nothing is.
std::string FaultOf(const Rule& rule);

// The rules of a JSON document; nothing, and why, when any of them is no rule.
std::optional<Rules> ReadImport(const std::string& szText, std::string& szFault);

struct Choice {
    size_t nRule = std::string::npos;
    std::string szFault = {};  // why none is chosen
};
// The rule with this id, else the one with this name, else the one that forwards this router port and no other.
Choice Choose(const Rules& rules, const std::string& szWhich);

}  // namespace tavo::cli
