// Saves the rules given as arguments, under the lock, and prints one line of JSON about it.
// Usage: saver GATEWAY [ID,ENABLED,PROTOCOL,ROUTERPORTS,BOXPORTS]... ; several ports are joined by ";".
#include <algorithm>
#include <cstdio>
#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "libtavoportmap.h"

namespace {

void Note(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT* pResult, void* pData) {
    static_cast<std::vector<int>*>(pData)->push_back(pResult->nProgress);
}

template <size_t N>
void Fill(char (&szField)[N], std::string szText) {
    std::replace(szText.begin(), szText.end(), ';', ',');
    std::snprintf(szField, N, "%s", szText.c_str());
}

__tag_TAVO_ROUTER_RULE Rule(const char* szText) {
    __tag_TAVO_ROUTER_RULE rule = {};
    std::istringstream stream(szText);
    std::string rgszParts[5];
    for (std::string& szPart : rgszParts) {
        std::getline(stream, szPart, ',');
    }
    Fill(rule.szRuleID, rgszParts[0]);
    rule.blEnable = rgszParts[1] == "1";
    Fill(rule.szProtocol, rgszParts[2]);
    Fill(rule.szRouterPort, rgszParts[3]);
    Fill(rule.szSrcPort, rgszParts[4]);
    Fill(rule.szServiceName, "service " + rgszParts[0]);
    return rule;
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<__tag_TAVO_ROUTER_RULE> rgRules;
    for (int i = 2; i < argc; ++i) {
        rgRules.push_back(Rule(argv[i]));
    }
    std::vector<int> rgProgress;
    __tag_TAVO_ROUTER_SAVE_RULE_RESULT result = {};
    const int nResult =
        TLibSaveRules(argv[1], static_cast<int>(rgRules.size()), rgRules.data(), true, &result, &Note, &rgProgress);
    std::printf("{\"result\": %d, \"status\": %d, \"ports\": \"%s\", \"limit\": %d, \"progress\": [", nResult,
                result.nStatus, result.nStatus == 8 || result.nStatus == 9 ? result.szPortList : "",
                result.nStatus == 7 || result.nStatus >= 10 ? result.nLimit : 0);
    for (size_t i = 0; i < rgProgress.size(); ++i) {
        std::printf("%s%d", i == 0 ? "" : ", ", rgProgress[i]);
    }
    std::printf("]}\n");
    return nResult == 0 ? 0 : 1;
}
