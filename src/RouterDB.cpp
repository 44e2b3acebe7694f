// The description of the manual router behind a gateway, flat and typed, and the list of known models.
// Relies on the platform's description loader, model list and refresh. Promises: the description is
// built at most once; a failed build is tried again by the next accessor.

#include <strings.h>

#include <cstdlib>
#include <cstring>

#include "Border.h"
#include "Log.h"
#include "Sections.h"
#include "Text.h"
#include "libtavoportmap.h"

namespace {

constexpr char kFile[] = "src/RouterDB.cpp";
constexpr char kPortPage[] = "PF port page";
constexpr char kRangePage[] = "PF range page";

using tavo::lib::AtBorder;
using tavo::lib::ConfList;
using tavo::lib::LogError;
using tavo::lib::Refuse;

struct ScriptDeleter {
    void operator()(TAVO_ROUTER_SCRIPT* pOps) const { TAVORouterScriptFree(pOps); }
};

struct NameListDeleter {
    void operator()(TLIBCSzList* pNames) const { TLIBCSzListFree(pNames); }
};

// What all pages of a description have in common.
struct FlatDescription {
    int nSyntaxVersion = 0;
    int nMaxPort = 0;
    int nMaxRange = 0;
    int nPages = 0;
    bool blTCP = true;
    bool blUDP = true;
    bool blAll = true;
    bool blChPort = true;
    bool blPageRange = true;
    bool blRangeRange = true;

    void BookPage(const TAVO_PF_CONF& section);
    Json::Value ToJson() const;
};

bool IsWord(const char* szValue, const char* szWord) {
    return szValue != nullptr && strcasecmp(szValue, szWord) == 0;
}

void FlatDescription::BookPage(const TAVO_PF_CONF& section) {
    const auto fnValue = [&section](const char* szKey) { return TLIBCSzHashGetValue(section.pHash, szKey); };
    ++nPages;
    blTCP = blTCP && fnValue("tcp") != nullptr;
    blUDP = blUDP && fnValue("udp") != nullptr;
    blAll = blAll && fnValue("tcp_udp") != nullptr;
    blChPort = blChPort && IsWord(fnValue("change router port"), "yes");
    if (const char* szMax = fnValue("max rule"); szMax != nullptr) {
        (std::strcmp(section.szSection, kPortPage) == 0 ? nMaxPort : nMaxRange) = tavo::lib::ToInt(szMax);
    }
    const char* szRange = fnValue("support range");
    if (!IsWord(szRange, "single") && !IsWord(szRange, "multi")) {
        if (strcasecmp(section.szSection, kPortPage) == 0) {
            blPageRange = false;
        } else if (strcasecmp(section.szSection, kRangePage) == 0) {
            blRangeRange = false;
        }
    }
}

Json::Value FlatDescription::ToJson() const {
    const bool blPages = nPages > 0;
    Json::Value jsDesc(Json::objectValue);
    jsDesc["syntaxVersion"] = nSyntaxVersion;
    jsDesc["supportTCP"] = blPages && blTCP;
    jsDesc["supportUDP"] = blPages && blUDP;
    jsDesc["supportALL"] = blPages && blAll;
    jsDesc["supportChPort"] = blPages && blChPort;
    jsDesc["supportPageRange"] = blPages && blPageRange;
    jsDesc["supportRangeRange"] = blPages && blRangeRange;
    jsDesc["max_port_rule"] = nMaxPort;
    jsDesc["max_range_rule"] = nMaxRange;
    return jsDesc;
}

FlatDescription Flatten(const TAVO_PF_CONF* pDesc) {
    FlatDescription flat;
    for (const TAVO_PF_CONF* pSection = pDesc; pSection != nullptr; pSection = pSection->pNext) {
        if (pSection->pHash == nullptr) {
            continue;
        }
        if (std::strcmp(pSection->szSection, "global") == 0) {
            if (const char* szVersion = TLIBCSzHashGetValue(pSection->pHash, "syntax version"); szVersion != nullptr) {
                flat.nSyntaxVersion = tavo::lib::ToInt(szVersion);
            }
        } else if (std::strcmp(pSection->szSection, kPortPage) == 0 ||
                   std::strcmp(pSection->szSection, kRangePage) == 0) {
            flat.BookPage(*pSection);
        }
    }
    return flat;
}

// One member of the description, which is built first where it has not been yet.
const Json::Value* Member(RouterDB& db, const int& blLoaded, const Json::Value& jsDesc, const char* szMember,
                          int nLine) {
    if (blLoaded == 0 && !db.GetRouterDesc()) {
        LogError("%s:%d can not get router desc", kFile, nLine);
        return nullptr;
    }
    return &jsDesc[szMember];
}

bool TakeInt(const Json::Value* pJsValue, const char* szWrongType, int nLine, int& nValue) {
    if (pJsValue == nullptr) {
        return false;
    }
    if (!pJsValue->isInt()) {
        return Refuse(szWrongType, kFile, nLine);
    }
    nValue = pJsValue->asInt();
    return true;
}

bool TakeBool(const Json::Value* pJsValue, const char* szWrongType, int nLine, bool& blValue) {
    if (pJsValue == nullptr) {
        return false;
    }
    if (!pJsValue->isBool()) {
        return Refuse(szWrongType, kFile, nLine);
    }
    blValue = pJsValue->asBool();
    return true;
}

// A list that is given up unless it was finished.
struct UnfinishedDeleter {
    void operator()(__tag_TAVO_ROUTERDB_LIST* pHead) const {
        if (!RouterDB::FreeList(pHead)) {
            LogError("%s:%d FreeList(head) failed", kFile, __LINE__);
        }
    }
};
using Models = std::unique_ptr<__tag_TAVO_ROUTERDB_LIST, UnfinishedDeleter>;

bool FillModel(__tag_TAVO_ROUTERDB_LIST& model, const char* szName) {
    using tavo::lib::FillText;
    std::string szCopy = szName;
    std::string szBrand;
    std::string szModel;
    std::string szVersion;
    if (!SplitRouterName(szCopy.data(), szBrand, szModel, szVersion)) {
        return Refuse("%s:%d split router name failed", kFile, __LINE__);
    }
    FillText(model.szBrand, szBrand);
    FillText(model.szModel, szModel);
    FillText(model.szVersion, szVersion);
    bool blGeneric = false;
    model.blGeneric = IsGenericRouterName(blGeneric, szCopy.data()) && blGeneric ? 1 : 0;
    return true;
}

}  // namespace

RouterDB::RouterDB(const std::string& gwRouterIP) : mSzGwRouterIP(gwRouterIP), mBlLoaded(0) {}

RouterDB::~RouterDB() = default;

bool RouterDB::GetRouterDesc() {
    return AtBorder(false, [&] {
        const ConfList pConf(TAVOPFGwRouterConfGet());
        if (!pConf) {
            return Refuse("%s:%d get router conf failed", kFile, __LINE__);
        }
        const TAVO_PF_CONF* pSection = pConf.get();
        while (pSection != nullptr && mSzGwRouterIP != pSection->szSection) {
            pSection = pSection->pNext;
        }
        if (pSection == nullptr || pSection->pHash == nullptr) {
            return Refuse("%s:%d pRouterConf shall not be NULL", kFile, __LINE__);
        }
        TAVO_PF_CONF* pDescRaw = nullptr;
        TAVO_ROUTER_SCRIPT* pOpsRaw = nullptr;
        const int nLoaded = TAVOPFRouterDBLoadDescAndOpsByIp(pSection, &pDescRaw, &pOpsRaw);
        const ConfList pDesc(pDescRaw);
        const std::unique_ptr<TAVO_ROUTER_SCRIPT, ScriptDeleter> pOps(pOpsRaw);
        if (nLoaded < 0) {
            return Refuse("%s:%d get desc and script failed", kFile, __LINE__);
        }
        mJsDesc = Flatten(pDesc.get()).ToJson();
        mBlLoaded = 1;
        return true;
    });
}

bool RouterDB::GetSyntaxVersion(int& nVersion) {
    return AtBorder(false, [&] {
        return TakeInt(Member(*this, mBlLoaded, mJsDesc, "syntaxVersion", __LINE__),
                       "%s:%d syntaxVersion shall be int type", __LINE__, nVersion);
    });
}

bool RouterDB::GetMaxPorts(int& nMaxPorts) {
    return AtBorder(false, [&] {
        return TakeInt(Member(*this, mBlLoaded, mJsDesc, "max_port_rule", __LINE__),
                       "%s:%d max port rule shall be int type", __LINE__, nMaxPorts);
    });
}

bool RouterDB::GetMaxRange(int& nMaxRange) {
    return AtBorder(false, [&] {
        return TakeInt(Member(*this, mBlLoaded, mJsDesc, "max_range_rule", __LINE__),
                       "%s:%d max range rule shall be int type", __LINE__, nMaxRange);
    });
}

bool RouterDB::IsSupportChangePort(bool& blSupport) {
    return AtBorder(false, [&] {
        return TakeBool(Member(*this, mBlLoaded, mJsDesc, "supportChPort", __LINE__),
                        "%s:%d support port change shall be bool type", __LINE__, blSupport);
    });
}

bool RouterDB::IsSupportPageRange(bool& blSupport) {
    return AtBorder(false, [&] {
        return TakeBool(Member(*this, mBlLoaded, mJsDesc, "supportPageRange", __LINE__),
                        "%s:%d support page range shall be bool type", __LINE__, blSupport);
    });
}

bool RouterDB::List(__tag_TAVO_ROUTERDB_LIST** pplRouterDBList) {
    return AtBorder(false, [&] {
        if (pplRouterDBList == nullptr) {
            return Refuse("%s:%d pplRouterDBList is NULL", kFile, __LINE__);
        }
        TLIBCSzList* pNamesRaw = nullptr;
        const int nNames = RouterDBList(&pNamesRaw);
        const std::unique_ptr<TLIBCSzList, NameListDeleter> pNames(pNamesRaw);
        Models pHead;
        __tag_TAVO_ROUTERDB_LIST* pTail = nullptr;
        for (int i = 0; i < nNames; ++i) {
            const char* szName = TLIBCSzListGet(pNames.get(), i);
            if (szName == nullptr) {
                continue;
            }
            auto* pNode = static_cast<__tag_TAVO_ROUTERDB_LIST*>(std::calloc(1, sizeof(__tag_TAVO_ROUTERDB_LIST)));
            if (pNode == nullptr) {
                return Refuse("%s:%d malloc failed", kFile, __LINE__);
            }
            if (pTail == nullptr) {
                pHead.reset(pNode);
            } else {
                pTail->pNext = pNode;
            }
            pTail = pNode;
            if (!FillModel(*pNode, szName)) {
                return false;
            }
        }
        *pplRouterDBList = pHead.release();
        return true;
    });
}

bool RouterDB::FreeList(__tag_TAVO_ROUTERDB_LIST* plRouterDBList) {
    if (plRouterDBList == nullptr) {
        return Refuse("%s:%d plRouterDBList is NULL", kFile, __LINE__);
    }
    while (plRouterDBList != nullptr) {
        __tag_TAVO_ROUTERDB_LIST* pNext = plRouterDBList->pNext;
        std::free(plRouterDBList);
        plRouterDBList = pNext;
    }
    return true;
}

bool RouterDB::Update(int& nVersion) {
    nVersion = TAVOPFRouterDBUpdate();
    return nVersion >= 0;
}
