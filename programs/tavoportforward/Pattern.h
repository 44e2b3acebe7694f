// Regular expressions over a router's pages. Relies on PCRE2 and not on std::regex, which recurses once a
// character and so lets a long page end the program.
// Promises: a match costs bounded time and memory, whatever the page holds.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace tavo {

// What the groups of one match took: by name, and by number ("1" is the first); groups that took no part
// are missing.
using Captures = std::map<std::string, std::string>;

class Pattern {
public:
    // Nothing for an expression that cannot be read.
    static std::optional<Pattern> Compile(const std::string& szExpression);

    // The groups as FindAll() calls them: all numbers, and the names of those that have one.
    std::set<std::string> Groups() const;

    // All matches from left to right, nMost at most. Nothing when a match went beyond its bounds.
    std::optional<std::vector<Captures>> FindAll(const std::string& szText, size_t nMost) const;

private:
    struct Code;
    explicit Pattern(std::shared_ptr<const Code> pCode) : mPCode(std::move(pCode)) {}

    std::shared_ptr<const Code> mPCode;
};

}  // namespace tavo
