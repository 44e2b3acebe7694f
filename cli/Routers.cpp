// "routers": the models that the description database knows. Relies on TLibGetRouterDBList and
// TLibUpdateRouterDBList, which answer 1 for success. Promises: every word of the search must occur, in
// either case.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Commands.h"
#include "Table.h"
#include "tavo/portforward.h"

namespace tavo::cli {

namespace {

using ModelList = std::unique_ptr<__tag_TAVO_ROUTERDB_LIST, decltype(&TLibFreeRouterDBList)>;

struct Wish {
    std::vector<std::string> rgszWords;
    bool blUpdate = false;
};

constexpr char kNoServer[] =
    "no server is named to fetch descriptions from (database_url in [download] of /etc/tavo/platform.conf)";
constexpr char kHowToDescribe[] = "/usr/share/doc/tavoportmap/packaging/routerdb/README.md";

bool IsServerNamed() {
    return *GetRouterDBPath() != '\0';
}

bool Matches(const __tag_TAVO_ROUTERDB_LIST& model, const std::vector<std::string>& rgszWords) {
    const std::string szAll =
        CLI::detail::to_lower(std::string(model.szBrand) + " " + model.szModel + " " + model.szVersion);
    return std::all_of(rgszWords.begin(), rgszWords.end(), [&](const std::string& szWord) {
        return szAll.find(CLI::detail::to_lower(szWord)) != std::string::npos;
    });
}

void AddModel(const __tag_TAVO_ROUTERDB_LIST& model, Table& table, Reply& reply) {
    table.Add({Clean(model.szBrand), Clean(model.szModel),
               Clean(model.szVersion) + (model.blGeneric != 0 ? " (any version)" : "")});
    Json::Value js;
    js["brand"] = model.szBrand;
    js["model"] = model.szModel;
    js["version"] = model.szVersion;
    js["generic"] = model.blGeneric != 0;
    reply.jsAnswer["routers"].append(js);
}

Reply List(const std::vector<std::string>& rgszWords) {
    __tag_TAVO_ROUTERDB_LIST* pList = nullptr;
    if (TLibGetRouterDBList(&pList) != 1) {
        return Failure(
            "the router descriptions in /etc.defaults/portforward/routerdb cannot be read; the system log "
            "says why");
    }
    const auto fnFree = [](__tag_TAVO_ROUTERDB_LIST* pHead) { return pHead ? TLibFreeRouterDBList(pHead) : 0; };
    const ModelList pModels(pList, fnFree);
    Reply reply;
    reply.jsAnswer["routers"] = Json::arrayValue;
    Table table({"brand", "model", "version"});
    int nModels = 0;
    for (const auto* pModel = pList; pModel != nullptr; pModel = pModel->pNext, ++nModels) {
        if (Matches(*pModel, rgszWords)) {
            AddModel(*pModel, table, reply);
        }
    }
    reply.szBody = table.ToText();
    if (!reply.szBody.empty()) {
        return reply;
    }
    if (nModels == 0) {
        reply.szMessage = fmt::format(
            "no router descriptions are installed. Your own go to /etc/tavo/routerdb ({} says how); {}", kHowToDescribe,
            IsServerNamed() ? "'sudo tavoportmap routers --update' fetches those of the server that "
                              "database_url in /etc/tavo/platform.conf names"
                            : kNoServer);
    } else {
        reply.szMessage = fmt::format("none of the {} known routers matches; try a shorter word", nModels);
    }
    return reply;
}

// What a refresh says: an error, the version, or why there was nothing to do.
Reply Update(int& nVersion) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (!IsServerNamed()) {
        return Failure(kNoServer);
    }
    if (TLibUpdateRouterDBList(&nVersion) == 1) {
        return {};
    }
    return Failure(fmt::format("the router descriptions could not be updated, and the old ones stay: {}",
                               *TAVOPFRouterDBWhy() == '\0' ? "the system log says why" : Clean(TAVOPFRouterDBWhy())));
}

Reply Routers(const Wish& wish) {
    Json::Value jsVersion;
    if (wish.blUpdate) {
        int nVersion = -1;
        if (Reply updated = Update(nVersion); updated.enExit != kOk) {
            return updated;
        }
        jsVersion = nVersion;
    }
    Reply reply = List(wish.rgszWords);
    reply.jsAnswer["database_version"] = jsVersion;
    if (wish.blUpdate && reply.szMessage.empty()) {
        reply.szMessage = fmt::format("the descriptions are up to date (version {})", jsVersion.asInt());
    }
    return reply;
}

}  // namespace

void OfferRouters(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pRouters = AddCommand(app, "routers", "the router models that are known, searchable");
    pRouters->add_option("search", pWish->rgszWords, "words that must occur in brand, model or version; any case");
    pRouters->add_flag("--update", pWish->blUpdate, "fetch the newest descriptions first");
    pRouters->footer(
        "These descriptions are for routers that are driven through their own pages. A router with UPnP or NAT-PMP "
        "needs none.\n");
    pRouters->callback([pWish, &request] { request.fnCommand = [pWish] { return Routers(*pWish); }; });
}

}  // namespace tavo::cli
