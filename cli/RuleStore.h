// The stored rules: those in force (rule.conf), those edited and not saved yet (the draft beside it), and those that
// 'off' switched off. Relies on the library's readers and writer of rule.conf. Promises: rules that could not be read
// whole are never written back; a value is never cut, and a rule without a name stays so; an edit is not lost when
// somebody else changes rule.conf meanwhile, nor is what they changed.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Answer.h"
#include "TextFile.h"
#include "libtavoportmap.h"

namespace tavo::cli {

struct Rule {
    std::string szId;
    bool blEnabled = true;
    std::string szProtocol;
    std::string szRouterPorts;
    std::string szBoxPorts;
    std::string szServiceId;
    std::string szName;
};

using Rules = std::vector<Rule>;

// The rules in force. Nothing when rule.conf cannot be read.
std::optional<Rules> LoadRules();
// The same as the library's own array, with its cuts and lent names.
std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> LoadRecords();

// The rules as the next save would have them: those in force with the edits since. Nothing when either cannot be read.
std::optional<Rules> LoadDraft();
bool HasDraft();
// False when it could not be written; the old edits are still there then. Rules like those in force end the draft.
bool StoreDraft(const Rules& rules);
// True when no edit is left.
bool DropDraft();
// Which of the two files cannot be read, and what to do.
Reply Unreadable();

// The edits that lead from base to edited, made once more on current, which somebody else has changed since.
Rules Rebase(const Rules& base, const Rules& edited, const Rules& current);
// Whether they ask for the same, whatever their ids and the way that their ports are written.
bool IsSameContent(const Rule& one, const Rule& other);
// For each rule of one its fellow in other by id, and by content where an id stands twice; npos where there is none.
std::vector<size_t> Fellows(const Rules& one, const Rules& other);

// The rules that 'off' switched off; absent when it did not, or when somebody has opened ports or taken all of those
// rules away since.
ReadState ReadOff(Rules& rules);
inline std::optional<Rules> LoadOff() {
    Rules rules;
    return ReadOff(rules) == ReadState::kRead ? std::optional(std::move(rules)) : std::nullopt;
}
inline bool IsOff() {
    return LoadOff().has_value();
}
// It has switched rules off that nobody can tell any more.
inline bool IsOffUnreadable() {
    Rules rules;
    return ReadOff(rules) == ReadState::kUnreadable;
}
// What to do then.
extern const char kOffUnreadable[];
bool StoreOff(const Rules& rules);
bool DropOff();

// Most bytes of a list of ports: one that fills its record is taken for one that was cut.
inline constexpr size_t kMostPortText = TAVO_TEXT_SIZE - 2;
// Which rule is too long for a record, and what to do; empty when all of them fit.
std::string TooLong(const Rules& rules);
// As the library takes them; nothing when one is too long.
std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> ToRecords(const Rules& rules);

extern const char kUnreadable[];

Json::Value ToJson(const Rule& rule);

// The number that an id is or begins with; 0 for none, and for one that needs no successor.
int NumberOf(const std::string& szId);
// The id after the highest number.
std::string NextId(const Rules& rules);

// Says which rules there are.
Reply NoSuchRule(const Rules& rules, const std::string& szId);

// The ports of a text like "80,443,5000-5010", in its order; nothing when it cannot be read.
std::optional<std::vector<int>> ParsePorts(const std::string& szText);

// Why a text that the user wrote is no port list, although it may be read as one: "5000-4000" is rather a slip of the
// hand than an order to open a thousand ports. Empty when it is good.
std::string FaultOfPorts(const std::string& szText);

// Two enabled rules that want the same router port; the one that comes later in the file is szLater.
struct Overlap {
    std::string szLater;
    std::string szEarlier;
    std::string szPort;  // the first one, such as "443/tcp"
};
std::vector<Overlap> OverlapsOf(const Rules& rules);

}  // namespace tavo::cli
