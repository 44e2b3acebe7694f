// What is left of every store when the power goes at any moment: the old content or the new one, the new one once the
// writer has said that it is stored, and never a record that knows less than the router.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <memory>
#include <set>

// First: its Refusal is a record, the mapping core's a function.
#include "programs/tavoportforward/EarlierRecord.h"

#include "../../cli/TextFile.h"
#include "disk.h"
#include "ground/Descriptor.h"
#include "libtavoportmap.h"
#include "mapping/Carry.h"
#include "programs/common/MadeFile.h"
#include "programs/common/ToldFile.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/portforward.h"
#include "tavo/runkeys.h"
#include "tavo/task.h"
#include "wire/upnp/GatewayMemory.h"
#include "wire/upnptest/TestRules.h"
#include "world.h"

namespace {

constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
constexpr char kUserDb[] = "/etc/portforward/router_upnp.db.user";
constexpr char kTool[] = "/usr/tavo/bin/tavoportforward";
constexpr char kMadeFile[] = "/var/lib/tavo/upnp_made.conf";
constexpr char kDraft[] = "/etc/portforward/rule.conf.draft";
constexpr char kDatabase[] = "/etc.defaults/portforward/routerdb";
constexpr const char* kNone = "nothing";
constexpr char kBox[] = "192.168.1.2";
const tavo::RouterName kRouter{"192.168.1.1", "aa:bb"};

class PowerCuts : public StagedTest {
protected:
    void SetUp() override {
        StagedTest::SetUp();
        Write("/etc/portforward/router_upnp.db", "[Acme/R1/1.0]\nsupport=yes\nmax=32\n[Old//]\nmax=1\n");
        Write(std::string(kDatabase) + "/Acme/R1/1.0/router.des", "[global]\nsyntax version=1\n");
        WriteProgram(kTool, "echo 'syntax version=1'\n");
    }
    void TearDown() override {
        StagedTest::TearDown();
        gBlDirectoriesFail = false;
        gBlExchanges = true;
    }

    Disk mDisk{{"/etc", "/etc.defaults", "/var/lib"}};
};

// ---- the stores ----------------------------------------------------------------------------------------------

bool SaveRule(const char* szPort) {
    RouterRuleConfWriter writer;
    return writer.AddRule("1", true, szPort, "80", "tcp", "", "") != 0 && writer.Sync() != 0;
}

std::string SavedRule() {
    int nRules = 0;
    __tag_TAVO_ROUTER_RULE* pRules = nullptr;
    std::string szPort = "unreadable";
    if (TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr) == 0) {
        szPort = nRules == 1 ? pRules[0].szRouterPort : kNone;
    }
    TLibFreeRulesArr(pRules);
    return szPort;
}

bool SetSettings(const char* szUpnp, const char* szPass = "new") {
    return TLibSetRouterConf("192.168.1.1", NewSettings(szUpnp, "no", "me", szPass).get(), nullptr, true) == 0;
}

// The way and the password; who may read a password is checked in passing.
std::string SavedSettings() {
    const auto pConf = std::make_unique<__tag_TAVO_ROUTER_CONF>();
    const int nResult = TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, true);
    struct stat status = {};
    EXPECT_TRUE(stat(kRouterConf, &status) != 0 || (status.st_mode & 077U) == 0 || *pConf->szPass == '\0');
    return nResult == 0 ? std::string(pConf->szSupportUpnp) + pConf->szPass : nResult == 1 ? kNone : "unreadable";
}

bool SendReport() {
    gStage.blOn = true;
    gStage.fnRun = PackNothing;
    const bool blSent = TLibUploadTestUpnpCompatibilityFailResult() == 0;
    gStage = {};
    return blSent;
}

bool KeepMade(const char* szText) {
    tavo::MadeFile file(kMadeFile);
    file.Get().TurnTo(kRouter);
    file.Get().Here()[{"TCP", 1}] = {kBox, 1, szText, true, 0, 1};
    return file.Save();
}

std::string KeptMade() {
    tavo::MadeFile file(kMadeFile);
    file.Get().TurnTo(kRouter);
    return file.Get().Here().empty() ? kNone : file.Get().Here().begin()->second.szText;
}

bool KeepTold(const char* szOutside) {
    tavo::ToldFile file("upnpd");
    file.Get().szOutside = szOutside;
    file.Save();
    return true;
}

std::string KeptTold() {
    const std::string szOutside = tavo::ToldFile("upnpd").Get().szOutside;
    return szOutside.empty() ? kNone : szOutside;
}

constexpr char kPagesFile[] = "/var/lib/tavo/pages_made.conf";
constexpr char kEarlierFile[] = "/var/lib/tavo/manual_router.made";

// The forwarder's record; until there is one, that of an earlier version.
std::string KeptJobs() {
    tavo::MadeFile file(kPagesFile);
    file.Get().TurnTo({"192.168.1.1", ""});
    std::string szText;
    for (const auto& [key, made] : file.Get().Here()) {
        szText += std::to_string(key.second);
    }
    return !szText.empty() ? szText : access(kEarlierFile, F_OK) == 0 ? "earlier" : kNone;
}

bool TakeOverJobs() {
    tavo::MadeFile file(kPagesFile);
    tavo::TakeOverEarlierRecord(file);
    return access(kEarlierFile, F_OK) != 0;
}

std::string EarlierRow(int nPort) {
    const std::string szPort = std::to_string(nPort);
    return "[" + szPort + "]\ngateway=\"192.168.1.1\"\nbox=\"" + kBox + "\"\nprotocol=\"both\"\nrouter_first=\"" +
           szPort + "\"\nrouter_last=\"" + szPort + "\"\nbox_first=\"" + szPort + "\"\nname=\"x\"\n\n";
}

bool KeepTest(const char* szResult) {
    return tavo::SaveTestRules({{1, 1, true, szResult}});
}

std::string KeptTest() {
    const auto rgRules = tavo::LoadTestRules();
    return rgRules.empty() ? kNone : rgRules.front().szResult;
}

bool KeepKnown(const char* szLocation) {
    tavo::KeepRouter("192.168.1.1", {{szLocation, ""}});
    return true;
}

bool CacheBrand(const char* szBrand) {
    return SetDetectManualCache("192.168.1.1", szBrand, "", "") == 1;
}

bool RecordMost(int nMost) {
    RouterUpnpDBUserWriter writer("a/b/c");
    return writer.SetMaxRule(nMost) && writer.Sync();
}

bool StoreTask(const char* szValue) {
    NOS::Task task("@system", ".upnp_detector");
    return task.beginUpdate() == 1 && task.setProperty("k", szValue) == 1 && task.endUpdate() == 1;
}

std::string StoredTask() {
    NOS::Task task("@system", ".upnp_detector");
    task.reload();
    return task.getStringProperty("k", kNone);
}

std::string SectionValue(const char* szPath, const char* szSection, const char* szKey) {
    char szValue[64] = {};
    return TLIBCFileGetSectionValue(szPath, szSection, szKey, szValue, sizeof(szValue)) == 0 ? szValue : kNone;
}

std::string Keys() {
    std::string szText;
    for (const char* szKey : {"hand", "runupnpportmapping", "runnatpmpportmapping"}) {
        char szValue[16] = {};
        szText += TLIBCFileGetKeyValue(kSystemConf, szKey, szValue, sizeof(szValue), 0) >= 1 ? szValue : "-";
    }
    return szText;
}

bool WriteDraft(const char* szText) {
    return tavo::cli::WriteOwnFile(kDraft, szText);
}

std::string ReadDraft() {
    std::string szText;
    const auto enState = tavo::cli::ReadOwnFile(kDraft, szText);
    return enState == tavo::cli::ReadState::kRead ? szText : enState == tavo::cli::ReadState::kAbsent ? kNone : "half";
}

// A new edition, unpacked by calls that the recorder sees.
bool RefreshDatabase() {
    gStage.blOn = true;
    gStage.fnRun = [](const std::string& szCommand) {
        const size_t nMade = szCommand.find("mkdir '") + 7;
        const std::string szNew = szCommand.substr(nMade, szCommand.find('\'', nMade) - nMade);
        for (const char* szDir : {"", "/New", "/New/N1", "/New/N1/1"}) {
            mkdir((szNew + szDir).c_str(), 0755);
        }
        for (const auto& [szFile, szText] : {std::pair{"/version", std::string("version=\"2\"\n")},
                                             {"/New/N1/1/router.des", std::string("[global]\nsyntax version=1\n")}}) {
            const tavo::Descriptor fd(open((szNew + szFile).c_str(), O_WRONLY | O_CREAT, 0644));
            ASSERT_EQ(write(fd.Get(), szText.data(), szText.size()), static_cast<ssize_t>(szText.size()));
        }
    };
    const bool blRefreshed = TAVOPFRouterDBUpdate() == 2;
    gStage = {};
    return blRefreshed;
}

std::string KnownModels() {
    TLIBCSzList* pList = nullptr;
    std::string szText = RouterDBList(&pList) > 0 ? "" : kNone;
    for (int i = 0; pList != nullptr && i < TLIBCSzListCount(pList); ++i) {
        szText += TLIBCSzListGet(pList, i);
    }
    TLIBCSzListFree(pList);
    return szText;
}

struct Store {
    const char* szName;
    std::function<void()> fnBefore;
    std::function<bool()> fnWrite;  // whether it said that it has stored
    std::function<std::string()> fnRead;
    const char* szOld;
    const char* szNew;
    const char* szMeanwhile = "";  // what else may be found until the writer says that it has stored
    bool blSilent = false;         // it does not say whether it has
};

// One whose writer takes the content.
Store Plain(const char* szName, const std::function<bool(const char*)>& fnWrite, std::string (*pfnRead)(),
            const char* szOld, const char* szNew, const char* szMeanwhile = "", bool blSilent = false) {
    const auto fnBefore = [=] { return szOld == kNone || fnWrite(szOld); };
    return {szName, fnBefore, [=] { return fnWrite(szNew); }, pfnRead, szOld, szNew, szMeanwhile, blSilent};
}

// Two files are deleted before they are written, and may be missing until then: what is told of the router that was
// before must not outlive a write that fails (the detection's cache), and the newest record is the only one there is (a
// test's result). Whoever finds nothing asks the router, or tests it, anew. Settings that are tried stand there until
// they turn out to be of no use.
const std::vector<Store>& Stores() {
    static const auto fnOldSettings = [] { SetSettings("no", "old"); };
    static const auto fnOldTool = [] {
        fnOldSettings();
        WriteProgram(kTool, "echo 'syntax version=0'\n");
    };
    static const auto fnReadable = [] {
        SetSettings("yes");
        chmod(kRouterConf, 0644);
    };
    static const auto fnDetected = [] {
        fnOldSettings();
        Write("/var/lib/tavo/tasks/@system/.upnp_detector.json",
              R"({"router_brand":"Acme","router_model":"R1","router_version":"1.0","support_upnp":"yes",
                  "able_get_brand_model_version":"yes"})");
    };
    static const auto fnManual = [] { return SetSettings("no"); };
    static const std::vector<Store> rgStores = {
        Plain("rules", SaveRule, SavedRule, "1", "2"),
        Plain("the first rules", SaveRule, SavedRule, kNone, "2"),
        {"a UPnP router's settings", fnOldSettings, [] { return SetSettings("yes"); }, SavedSettings, "noold", "yes"},
        {"a manual router's settings", fnOldSettings, fnManual, SavedSettings, "noold", "nonew"},
        {"a router that becomes a manual one", fnReadable, fnManual, SavedSettings, "yes", "nonew"},
        {"settings that cannot be used", fnOldTool, [] { return !SetSettings("no"); }, SavedSettings, "noold", "noold",
         "nonew", true},
        {"a report", fnDetected, SendReport, SavedSettings, "noold", "noold"},
        Plain(
            "the detection's cache", CacheBrand,
            [] { return SectionValue(SZF_DETECT_MANUAL_CACHE.c_str(), "192.168.1.1", "brand"); }, "Old", "New", kNone),
        {"a test's result", [] { Write(kUserDb, "[a/b/c]\nmax=\"1\"\n"); }, [] { return RecordMost(2); },
         [] { return SectionValue(kUserDb, "a/b/c", "max"); }, "1", "2", kNone},
        {"a key", [] { Write(kSystemConf, "hand=\"h\"\nrunupnpportmapping=\"yes\"\n"); },
         [] { return TLIBCFileSetKeyValue(kSystemConf, "runupnpportmapping", "no", nullptr) == 1; }, Keys, "hyes-",
         "hno-"},
        Plain("upnpd's record", KeepMade, KeptMade, "old", "new"),
        Plain("upnpd's first record", KeepMade, KeptMade, kNone, "new"),
        Plain("what was told", KeepTold, KeptTold, "old", "new", "", true),
        {"the forwarder's record of an earlier version", [] { Write(kEarlierFile, EarlierRow(1) + EarlierRow(2)); },
         TakeOverJobs, KeptJobs, "earlier", "12"},
        Plain("a test's mappings", KeepTest, KeptTest, "old", "new"),
        Plain(
            "a known router", KeepKnown, [] { return tavo::RecallRouter("192.168.1.1").place.szLocation; }, "old",
            "new", "", true),
        Plain("a task", StoreTask, StoredTask, "old", "new"),
        Plain("the first task", StoreTask, StoredTask, kNone, "new"),
        Plain("a draft", WriteDraft, ReadDraft, "old", "new"),
        {"a draft that is dropped", [] { WriteDraft("old"); }, [] { return tavo::cli::RemoveOwnFile(kDraft); },
         ReadDraft, "old", kNone},
        {"router descriptions", [] {}, RefreshDatabase, KnownModels, "Acme: R1(1.0)", "New: N1(1)"},
        {"router descriptions where nothing can be exchanged", [] { gBlExchanges = false; }, RefreshDatabase,
         KnownModels, "Acme: R1(1.0)", "New: N1(1)"},
    };
    return rgStores;
}

class EachStore : public PowerCuts, public testing::WithParamInterface<size_t> {};

TEST_P(EachStore, HasTheOldOrTheNewContent) {
    const Store& store = Stores()[GetParam()];
    SCOPED_TRACE(store.szName);
    store.fnBefore();
    ASSERT_EQ(store.fnRead(), store.szOld);
    mDisk.Record([&] {
        EXPECT_TRUE(store.fnWrite());
        Mark();
    });
    ASSERT_TRUE(mDisk.IsWhole());
    ASSERT_EQ(store.fnRead(), store.szNew);
    const int nStates = mDisk.ForEachCut(
        [&](size_t nMarks) {
            const std::string szRead = store.fnRead();
            EXPECT_TRUE(szRead == store.szNew ||
                        (nMarks == 0 && (szRead == store.szOld || szRead == store.szMeanwhile)))
                << szRead << (nMarks == 0 ? "" : ", though it was said to be stored");
        },
        true);
    EXPECT_GT(nStates, 2);
    RecordProperty("states", nStates);
}

// A name that the disk does not flush may be another one after a power cut.
TEST_P(EachStore, SaysWhatMayNotLast) {
    const Store& store = Stores()[GetParam()];
    SCOPED_TRACE(store.szName);
    store.fnBefore();
    gBlDirectoriesFail = true;
    EXPECT_EQ(store.fnWrite(), store.blSilent);
}

INSTANTIATE_TEST_SUITE_P(, EachStore, testing::Range(size_t{0}, Stores().size()),
                         [](const auto& info) { return std::to_string(info.param); });

// ---- records and routers --------------------------------------------------------------------------------------

// A router that marks in the record of the disk what it was asked for.
class MarkingRouter : public tavo::Router {
public:
    explicit MarkingRouter(tavo::Abilities abilities) : mAbilities(std::move(abilities)) {}
    tavo::Abilities What() const override { return mAbilities; }
    tavo::RouterReply List(std::vector<tavo::RouterMapping>& rgMappings) override {
        for (const auto& [key, mapping] : mMapTable) {
            rgMappings.push_back(mapping);
        }
        return {};
    }
    tavo::RouterReply Get(const std::string& szProtocol, uint16_t nPort, tavo::RouterMapping& mapping) override {
        const auto it = mMapTable.find({szProtocol, nPort});
        if (it == mMapTable.end()) {
            return {tavo::Reply::kNoSuchEntry, "714"};
        }
        mapping = it->second;
        return {};
    }
    tavo::RouterReply Add(tavo::RouterMapping& mapping) override {
        mMapTable[tavo::KeyOf(mapping)] = mapping;
        Note();
        return {};
    }
    tavo::RouterReply Remove(const tavo::RouterMapping& mapping) override {
        const bool blGone = mMapTable.erase(tavo::KeyOf(mapping)) != 0;
        Note();
        return blGone ? tavo::RouterReply{} : tavo::RouterReply{tavo::Reply::kNoSuchEntry, "714"};
    }
    std::vector<std::set<tavo::MappingKey>> mRgOpen = {{}};  // at each mark

private:
    void Note() {
        mRgOpen.emplace_back();
        for (const auto& [key, mapping] : mMapTable) {
            mRgOpen.back().insert(key);
        }
        Mark();
    }
    tavo::Abilities mAbilities;
    std::map<tavo::MappingKey, tavo::RouterMapping> mMapTable;
};

// As upnpd and natpmpd see theirs.
const tavo::Abilities kRouters[] = {{}, {false, true, true}};

std::vector<tavo::RouterMapping> WantedPorts(std::initializer_list<uint16_t> rgPorts) {
    std::vector<tavo::RouterMapping> rgWanted;
    for (const uint16_t nPort : rgPorts) {
        rgWanted.push_back({"TCP", nPort, nPort, "", "tavo:" + std::to_string(nPort), 0, true});
    }
    return rgWanted;
}

class EachRouter : public PowerCuts, public testing::WithParamInterface<size_t> {};

TEST_P(EachRouter, IsAskedForWhatIsOnRecord) {
    MarkingRouter router(kRouters[GetParam()]);
    tavo::Habits habit;
    mDisk.Record([&] {
        tavo::MadeFile file(kMadeFile);
        file.Get().TurnTo(kRouter);
        const tavo::Surroundings around{kBox, tavo::BootSeconds, [] { return false; }, [&] { return file.Save(); }};
        for (const auto& rgWanted : {WantedPorts({1}), WantedPorts({2, 3}), WantedPorts({3})}) {
            tavo::BringInLine(router, rgWanted, file.Get(), habit, around);
        }
    });
    ASSERT_EQ(router.mRgOpen.size(), 6U);
    // What is gone at the router may be on record still; what may be there has to be.
    const int nStates = mDisk.ForEachCut([&](size_t nMarks) {
        tavo::MadeFile file(kMadeFile);
        file.Get().TurnTo(kRouter);
        for (const tavo::MappingKey& key : router.mRgOpen[nMarks]) {
            EXPECT_TRUE(file.Get().Here().contains(key)) << key.second;
        }
    });
    EXPECT_GT(nStates, 10);
}

// ---- a record that cannot be written -------------------------------------------------------------------------------

// A port that nobody could remember is not opened, one that stands is renewed, and the log says so once.
TEST_P(EachRouter, IsAskedForNothingNewThatCannotBeRemembered) {
    MarkingRouter router(kRouters[GetParam()]);
    tavo::MadeFile file(kMadeFile);
    file.Get().TurnTo(kRouter);
    tavo::Habits habit;
    int64_t nNow = 1000;
    const auto fnPass = [&](std::initializer_list<uint16_t> rgPorts) {
        nNow += 2000;
        tavo::BringInLine(router, WantedPorts(rgPorts), file.Get(), habit,
                          {kBox, [&] { return nNow; }, [] { return false; }, [&] { return file.Save(); }});
        return router.mRgOpen.back();
    };
    const std::set<tavo::MappingKey> one = {{"TCP", 1}};
    const std::set<tavo::MappingKey> both = {{"TCP", 1}, {"TCP", 2}};
    EXPECT_EQ(fnPass({1}), one);
    gBlDirectoriesFail = true;
    gLog.clear();
    for (int i = 0; i < 3; ++i) {
        const size_t nAsked = router.mRgOpen.size();
        EXPECT_EQ(fnPass({1, 2}), one);
        EXPECT_EQ(router.mRgOpen.size(), nAsked + 1) << "one renewal, and nothing else";
    }
    const auto fnSays = [](const std::string& szLine) { return szLine.starts_with(std::string("write ") + kMadeFile); };
    EXPECT_EQ(std::count_if(gLog.begin(), gLog.end(), fnSays), 1);
    gBlDirectoriesFail = false;
    EXPECT_EQ(fnPass({1, 2}), both);
}

INSTANTIATE_TEST_SUITE_P(, EachRouter, testing::Range(size_t{0}, std::size(kRouters)));

// One damaged line costs one row; the only memory of an open port is not thrown away with it.
TEST_F(PowerCuts, ADamagedRecordKeepsWhatCanBeRead) {
    std::string szText = EarlierRow(1) + EarlierRow(2) + EarlierRow(3);
    const size_t nAt = szText.find("box_first=\"2\"");
    ASSERT_NE(nAt, std::string::npos);
    Write(kEarlierFile, szText.replace(nAt, 3, std::string(3, '\0')));
    EXPECT_TRUE(TakeOverJobs()) << "it is put aside";
    EXPECT_EQ(KeptJobs(), "13");
}

// ---- the run keys ----------------------------------------------------------------------------------------------

// The box after its next start: nothing of before lives.
class NextBoot {
public:
    NextBoot() {
        Write("/tmp/next_boot", "00000000-0000-4000-8000-000000000000\n");
        EXPECT_EQ(mount("/tmp/next_boot", kBootId, nullptr, MS_BIND, nullptr), 0);
    }
    ~NextBoot() { umount2(kBootId, MNT_DETACH); }
    NextBoot(const NextBoot&) = delete;
    NextBoot& operator=(const NextBoot&) = delete;

private:
    static constexpr char kBootId[] = "/proc/sys/kernel/random/boot_id";
};

bool SaveAsTheToolDoes() {
    gStage = Stage();
    gStage.blOn = true;
    gFnOnSleep = [] { unlink("/tmp/pfProgress"); };
    Write("/var/tmp/upnp_portmap.status", "8080/tcp=1\n");
    __tag_TAVO_ROUTER_RULE rule = {"1", true, "tcp", "80", "8080", "web", "Web", {}};
    EXPECT_EQ(TAVORunKeysRemember(), 0);
    const bool blSaved = TLibSaveRules("192.168.1.1", 1, &rule, false, nullptr, nullptr, nullptr) == 0;
    EXPECT_TRUE(blSaved) << gLog.back();
    EXPECT_EQ(TAVORunKeysForget(), 0);
    gStage = {};
    return blSaved;
}

TEST_F(PowerCuts, ASaveThatIsCutOffLeavesTheDaemonOn) {
    SetSettings("yes");
    SaveRule("1");
    Write(kSystemConf, "hand=\"h\"\nrunupnpportmapping=\"yes\"\nrunnatpmpportmapping=\"no\"\n");
    mDisk.Record([&] {
        EXPECT_TRUE(SaveAsTheToolDoes());
        Mark();
    });
    ASSERT_TRUE(mDisk.IsWhole());
    const NextBoot boot;
    const int nStates = mDisk.ForEachCut([&](size_t nMarks) {
        EXPECT_EQ(TAVORunKeysMend(), 0);
        EXPECT_EQ(Keys(), "hyesno");
        EXPECT_TRUE(SavedRule() == "80" || (nMarks == 0 && SavedRule() == "1")) << SavedRule();
    });
    EXPECT_GT(nStates, 10);
}

// Whoever writes the file of the keys between a killed save and its mending: his keys stand, if he wrote them.
TEST_F(PowerCuts, WhatOthersWriteBesideTheKeysIsKeptAndTheKeysComeBack) {
    const auto fnReplace = [](const std::string& szOld, const std::string& szNew) {
        std::string szText = Read(kSystemConf);
        const size_t nAt = szText.find(szOld);
        ASSERT_NE(nAt, std::string::npos) << szText;
        std::filesystem::remove(kSystemConf);
        Write(kSystemConf, szText.replace(nAt, szOld.size(), szNew));
    };
    const auto fnSet = [](const char* szKey, const char* szValue) {
        EXPECT_EQ(TLIBCFileSetKeyValue(kSystemConf, szKey, szValue, nullptr), 1);
    };
    const auto fnOther = [&] {
        fnSet("runnatpmpportmapping", "yes");
        fnSet("hand", "g");
    };
    const std::tuple<const char*, std::function<void()>, const char*> rgCases[] = {
        {"nobody", [] {}, "hyesno"},
        {"another key", [&] { fnSet("hand", "g"); }, "gyesno"},
        {"another key, by an editor", [&] { fnReplace("hand=\"h\"", "hand=\"g\""); }, "gyesno"},
        {"a new key", [&] { fnSet("more", "m"); }, "hyesno"},
        {"the same, word for word", [&] { fnReplace("hand", "hand"); }, "hnono"},
        {"the key itself", [&] { fnSet("runupnpportmapping", "no"); }, "hnono"},
        {"the other daemon and another key", fnOther, "gnoyes"}};
    SetSettings("yes");
    for (const auto& [szWhat, fnWrite, szKeys] : rgCases) {
        std::filesystem::remove_all("/var/lib/tavo");
        Write(kSystemConf, "hand=\"h\"\nrunupnpportmapping=\"yes\"\nrunnatpmpportmapping=\"no\"\n");
        const pid_t pid = fork();
        if (pid == 0) {
            const bool blBegun = TAVORunKeysRemember() == 0 &&
                                 TLIBCFileSetKeyValue(kSystemConf, "runupnpportmapping", "no", nullptr) == 1;
            _exit(blBegun ? 0 : 1);
        }
        int nStatus = 1;
        ASSERT_EQ(waitpid(pid, &nStatus, 0), pid);
        ASSERT_EQ(nStatus, 0);
        ASSERT_EQ(Keys(), "hnono");
        fnWrite();
        EXPECT_EQ(TAVORunKeysMend(), 0) << szWhat;
        EXPECT_EQ(Keys(), szKeys) << szWhat;
    }
}

}  // namespace
