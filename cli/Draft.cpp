// The edits that are not saved yet, and what 'off' remembers. Relies on jsoncpp. Promises: see RuleStore.h; a text
// that is no UTF-8 survives the file.
#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <set>

#include "Box.h"
#include "JsonText.h"
#include "PortPairs.h"
#include "RuleStore.h"
#include "TextFile.h"

namespace tavo::cli {

namespace {

constexpr char kDraft[] = "/etc/portforward/rule.conf.draft";
constexpr char kOff[] = "/etc/portforward/rules.off";
constexpr size_t kNone = std::string::npos;

// ---- rules in JSON -----------------------------------------------------------------------------------------

// The object that szText is, without members where it is none.
Json::Value ObjectOf(const std::string& szText) {
    const auto js = ReadJson(szText);
    return js && js->isObject() ? *js : Json::objectValue;
}

std::string Format(const Json::Value& js) {
    return Json::writeString(Json::StreamWriterBuilder(), js) + "\n";
}

// A text as it is, or the numbers of its bytes where JSON cannot hold it.
Json::Value Lossless(const std::string& szText) {
    Json::Value js;
    js["t"] = szText;
    if (ObjectOf(Format(js))["t"] == js["t"]) {
        return js["t"];
    }
    Json::Value jsBytes = Json::arrayValue;
    for (const char c : szText) {
        jsBytes.append(static_cast<unsigned char>(c));
    }
    return jsBytes;
}

std::optional<std::string> TextOf(const Json::Value& js) {
    if (js.isString()) {
        return js.asString();
    }
    std::string szText;
    for (const Json::Value& jsByte : js) {
        if (!jsByte.isUInt() || jsByte.asUInt() > UINT8_MAX) {
            return std::nullopt;
        }
        szText += static_cast<char>(jsByte.asUInt());
    }
    return js.isArray() ? std::optional(szText) : std::nullopt;
}

Json::Value ToFile(const Rules& rules) {
    Json::Value jsRules = Json::arrayValue;
    for (const Rule& rule : rules) {
        Json::Value js;
        js["id"] = Lossless(rule.szId);
        js["enabled"] = rule.blEnabled;
        js["protocol"] = Lossless(rule.szProtocol);
        js["router_ports"] = Lossless(rule.szRouterPorts);
        js["box_ports"] = Lossless(rule.szBoxPorts);
        js["service_id"] = Lossless(rule.szServiceId);
        js["name"] = Lossless(rule.szName);
        jsRules.append(js);
    }
    return jsRules;
}

std::optional<Rules> FromFile(const Json::Value& jsRules) {
    if (!jsRules.isArray()) {
        return std::nullopt;
    }
    Rules rules;
    for (const Json::Value& js : jsRules) {
        if (!js.isObject() || !js["enabled"].isBool()) {
            return std::nullopt;
        }
        Rule rule;
        rule.blEnabled = js["enabled"].asBool();
        for (const auto& [szKey, pSzField] :
             std::initializer_list<std::pair<const char*, std::string*>>{{"id", &rule.szId},
                                                                         {"protocol", &rule.szProtocol},
                                                                         {"router_ports", &rule.szRouterPorts},
                                                                         {"box_ports", &rule.szBoxPorts},
                                                                         {"service_id", &rule.szServiceId},
                                                                         {"name", &rule.szName}}) {
            const auto szText = TextOf(js[szKey]);
            if (!szText) {
                return std::nullopt;
            }
            *pSzField = *szText;
        }
        rules.push_back(rule);
    }
    return rules;
}

// ---- comparing ---------------------------------------------------------------------------------------------

// What two rules have in common when they are the same in this way. Keys are sorted instead of every rule being held
// against every other one: a file may have tens of thousands.
using Key = std::vector<std::string>;

// A text that every spelling of a list has in common; one that cannot be read is like itself only.
std::string ListKey(const std::string& szList) {
    const auto rgPorts = ParsePorts(szList);
    return rgPorts ? PortsText(*rgPorts) : "?" + szList;
}

Key ForwardKey(const Rule& rule) {
    return {rule.szProtocol, ListKey(rule.szRouterPorts), ListKey(rule.szBoxPorts)};
}

Key ContentKey(const Rule& rule) {
    Key key = ForwardKey(rule);
    key.insert(key.end(), {rule.blEnabled ? "on" : "off", rule.szName, rule.szServiceId});
    return key;
}

Key IdKey(const Rule& rule) {
    return {rule.szId};
}

Key WholeKey(const Rule& rule) {
    Key key = ContentKey(rule);
    key.push_back(rule.szId);
    return key;
}

bool IsSameForward(const Rule& one, const Rule& other) {
    const bool blSpelledAlike = one.szRouterPorts == other.szRouterPorts && one.szBoxPorts == other.szBoxPorts;
    return one.szProtocol == other.szProtocol && (blSpelledAlike || ForwardKey(one) == ForwardKey(other));
}

bool IsSameSet(const Rules& one, const Rules& other) {
    return std::equal(one.begin(), one.end(), other.begin(), other.end(), [](const Rule& rule, const Rule& fellow) {
        return rule.szId == fellow.szId && IsSameContent(rule, fellow);
    });
}

// Pairs rules off, each at most once: by the first key as far as it goes, then by the next.
std::vector<size_t> Pair(const Rules& one, const Rules& other, std::initializer_list<Key (*)(const Rule&)> rgKeys) {
    std::vector<size_t> rgFellows(one.size(), kNone);
    std::vector<bool> rgTaken(other.size(), false);
    for (const auto pfnKey : rgKeys) {
        std::map<Key, std::vector<size_t>> mapFree;  // the first of them last
        for (size_t j = other.size(); j-- > 0;) {
            if (!rgTaken[j]) {
                mapFree[pfnKey(other[j])].push_back(j);
            }
        }
        for (size_t i = 0; i < one.size() && !mapFree.empty(); ++i) {
            const auto it = rgFellows[i] == kNone ? mapFree.find(pfnKey(one[i])) : mapFree.end();
            if (it != mapFree.end() && !it->second.empty()) {
                rgFellows[i] = it->second.back();
                rgTaken[rgFellows[i]] = true;
                it->second.pop_back();
            }
        }
    }
    return rgFellows;
}

// What the user changed, on what others changed.
Rule Merged(const Rule& base, const Rule& edited, const Rule& current) {
    Rule merged = current;
    if (base.blEnabled != edited.blEnabled) {
        merged.blEnabled = edited.blEnabled;
    }
    if (!IsSameForward(base, edited)) {  // ports go in pairs, so they change together
        merged.szProtocol = edited.szProtocol;
        merged.szRouterPorts = edited.szRouterPorts;
        merged.szBoxPorts = edited.szBoxPorts;
    }
    merged.szName = base.szName != edited.szName ? edited.szName : merged.szName;
    merged.szServiceId = base.szServiceId != edited.szServiceId ? edited.szServiceId : merged.szServiceId;
    return merged;
}

// Rules that come together, and what has to be known of them to add one more.
class Gathered {
public:
    void Take(Rule rule) {
        mSetIds.insert(rule.szId);
        mSetContents.insert(ContentKey(rule));
        mNLast = std::max(mNLast, NumberOf(rule.szId));
        mRules.push_back(std::move(rule));
    }
    // A rule that only the edits have, unless somebody else has made the same one.
    void Append(Rule rule) {
        if (mSetContents.count(ContentKey(rule)) > 0) {
            return;
        }
        if (mSetIds.count(rule.szId) > 0) {
            rule.szId = std::to_string(mNLast + 1);
        }
        Take(std::move(rule));
    }
    const Rules& All() const { return mRules; }

private:
    Rules mRules;
    std::set<std::string> mSetIds;
    std::set<Key> mSetContents;
    int mNLast = 0;
};

// The rules in force when none of them is on.
std::optional<Rules> LoadIfEachIsOff() {
    auto inForce = LoadRules();
    const bool blAnyOn =
        inForce && std::any_of(inForce->begin(), inForce->end(), [](const Rule& r) { return r.blEnabled; });
    return blAnyOn ? std::nullopt : inForce;
}

}  // namespace

bool IsSameContent(const Rule& one, const Rule& other) {
    return one.blEnabled == other.blEnabled && one.szName == other.szName && one.szServiceId == other.szServiceId &&
           IsSameForward(one, other);
}

std::vector<size_t> Fellows(const Rules& one, const Rules& other) {
    return Pair(one, other, {&WholeKey, &IdKey});
}

Rules Rebase(const Rules& base, const Rules& edited, const Rules& current) {
    const std::vector<size_t> rgBase = Pair(current, base, {&WholeKey, &ContentKey, &ForwardKey});
    const std::vector<size_t> rgEdited = Fellows(base, edited);
    const std::vector<size_t> rgOrigin = Fellows(edited, base);
    std::vector<bool> rgIsThere(base.size(), false);
    Gathered rules;
    for (size_t i = 0; i < current.size(); ++i) {
        if (rgBase[i] == kNone) {
            rules.Take(current[i]);
            continue;
        }
        rgIsThere[rgBase[i]] = true;
        if (const size_t nEdited = rgEdited[rgBase[i]]; nEdited != kNone) {
            rules.Take(Merged(base[rgBase[i]], edited[nEdited], current[i]));
        }
    }
    for (size_t i = 0; i < edited.size(); ++i) {
        const size_t nBase = rgOrigin[i];
        // What others removed is gone, unless the user has changed it.
        if (nBase == kNone || (!rgIsThere[nBase] && !IsSameContent(base[nBase], edited[i]))) {
            rules.Append(edited[i]);
        }
    }
    return rules.All();
}

// ---- the draft ---------------------------------------------------------------------------------------------

std::optional<Rules> LoadDraft() {
    auto inForce = LoadRules();
    std::string szText;
    const ReadState enState = ReadOwnFile(kDraft, szText);
    if (!inForce || enState == ReadState::kAbsent) {
        return inForce;
    }
    if (enState == ReadState::kUnreadable) {
        return std::nullopt;
    }
    const Json::Value js = ObjectOf(szText);
    const auto base = FromFile(js["base"]);
    const auto edited = FromFile(js["rules"]);
    return base && edited ? std::optional(Rebase(*base, *edited, *inForce)) : std::nullopt;
}

bool HasDraft() {
    std::string szText;
    if (ReadOwnFile(kDraft, szText) == ReadState::kAbsent) {
        return false;
    }
    const auto inForce = LoadRules();
    const auto draft = LoadDraft();
    return !inForce || !draft || !IsSameSet(*inForce, *draft);
}

bool StoreDraft(const Rules& rules) {
    const auto inForce = LoadRules();
    if (!inForce) {
        return false;
    }
    if (IsSameSet(*inForce, rules)) {
        return DropDraft();
    }
    Json::Value js;
    js["base"] = ToFile(*inForce);
    js["rules"] = ToFile(rules);
    return WriteOwnFile(kDraft, Format(js));
}

bool DropDraft() {
    return RemoveOwnFile(kDraft);
}

Reply Unreadable() {
    return Failure(LoadRules()
                       ? fmt::format("the edits that are not saved yet cannot be read ({}); 'sudo tavoportmap rules "
                                     "discard' drops them, and the rules in force stay as they are",
                                     kDraft)
                       : kUnreadable);
}

// ---- off ---------------------------------------------------------------------------------------------------

// The note of an 'off' or 'on' that was killed stays, and says nothing once the rules that it names are gone.
ReadState ReadOff(Rules& rules) {
    const auto inForce = LoadIfEachIsOff();
    std::string szText;
    const ReadState enState = inForce && !inForce->empty() ? ReadOwnFile(kOff, szText) : ReadState::kAbsent;
    const auto noted = enState == ReadState::kRead ? FromFile(ObjectOf(szText)["rules"]) : std::nullopt;
    if (!noted) {
        return enState == ReadState::kAbsent ? enState : ReadState::kUnreadable;
    }
    const bool blHolds = std::any_of(noted->begin(), noted->end(), [&](Rule rule) {
        rule.blEnabled = false;
        return std::any_of(inForce->begin(), inForce->end(),
                           [&](const Rule& there) { return IsSameContent(there, rule); });
    });
    rules = blHolds ? *noted : Rules();
    return blHolds ? ReadState::kRead : ReadState::kAbsent;
}

const char kOffUnreadable[] =
    "what 'off' has switched off cannot be read (/etc/portforward/rules.off); 'sudo tavoportmap rules list' shows the "
    "rules, 'sudo tavoportmap rules enable RULE' and 'sudo tavoportmap save' open one again";

bool StoreOff(const Rules& rules) {
    Json::Value js;
    js["rules"] = ToFile(rules);
    return WriteOwnFile(kOff, Format(js));
}

bool DropOff() {
    return RemoveOwnFile(kOff);
}

}  // namespace tavo::cli
