// A judged situation as text and as JSON. Relies on fmt and jsoncpp. Promises: the text keeps to the terminal; the
// members of the JSON are those of the man page, each of them always there.
#pragma once

#include "Judgement.h"

namespace tavo::cli {

// blAges: how long ago things were, too, which is another text every second.
std::string ToText(const Situation& situation, const Judgement& judgement, bool blAges);
Json::Value ToJson(const Situation& situation, const Judgement& judgement);

// A line for each rule and port that fares alike: what "status --watch" tells of.
std::vector<std::string> ToLines(const Situation& situation, const Judgement& judgement);

}  // namespace tavo::cli
