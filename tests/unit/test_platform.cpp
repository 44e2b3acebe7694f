// The platform: files that survive any value and any failure, processes, port lists, the database.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstdio>
#include <functional>
#include <set>
#include <thread>
#include <utility>

#include "Log.h"
#include "ground/Directory.h"
#include "ground/FileLock.h"
#include "ground/LogFile.h"
#include "ground/OwnFile.h"
#include "ground/PortText.h"
#include "ground/Suffix.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "programs/common/RuleFile.h"
#include "programs/tavohook/Hooks.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/log.h"
#include "tavo/net.h"
#include "tavo/portforward.h"
#include "wire/upnptest/TestRules.h"
#include "world.h"

namespace {

constexpr char kPath[] = "/tmp/t/file";
constexpr char kKeys[] = "/tmp/t/keys";

// What no caller may ask for, answered by -1 or null, with the reason; beside it what he just may.
TEST(Platform, WhatCannotBeAskedForIsRefusedAndChangesNothing) {
    const auto fnRefused = [](long nAnswers, long nWanted, int nErr = TLIBC_ERR_BAD_PARAMETER) {
        EXPECT_EQ(nAnswers, nWanted);
        EXPECT_EQ(TLIBCErrGet(), nErr);
        EXPECT_TRUE(TLIBCErrorGetLine() > 0 && *TLIBCErrorGetFile() != '\0');
        TLIBCErrSet(TLIBC_ERR_NONE, nullptr, 0);
    };
    const auto fnNull = [](const void* p) { return p == nullptr ? -1 : 0; };
    const auto fnSet = [](const char* szKey, const char* szFormat) {
        return TLIBCFileSetKeyValue(kKeys, szKey, "v", szFormat);
    };
    const auto fnValue = [](const char* szPath, const char* szSection, const char* szKey, char* szOut, int nSize) {
        return TLIBCFileGetSectionValue(szPath, szSection, szKey, szOut, nSize);
    };
    constexpr const char* kNo = nullptr;
    constexpr char kIp[] = "1.1.1.1";
    const std::string szMost(127, 'n');
    TLIBCSzHash* pHash = TLIBCSzHashAlloc(0);
    TLIBCSzList* pList = TLIBCSzListAlloc(0);
    TLIBCSzHash* pOut = nullptr;
    const char* szKey = nullptr;
    const char* szValue = nullptr;
    char szText[16] = "as it was";
    TAVO_NET_CARD card = {};
    ASSERT_EQ(TLIBCSzHashSetValue(pHash, "k", "v") + TLIBCSzListPush(pList, "item"), 2);
    Write(kPath, "[s]\nk=v\n");
    Write(kKeys, "k=v\n");
    fnRefused(TLIBCFileTouch(kNo) + TLIBCFileExist(kNo), -1);
    fnRefused(TLIBCFileTouch("/nowhere/x"), -1, TLIBC_ERR_OPEN);
    fnRefused(TLIBCFileGetSection(kNo, "s", pHash) + TLIBCFileGetSection(kPath, kNo, pHash), -2);
    fnRefused(TLIBCFileGetSection(kPath, "s", nullptr) + TLIBCFileAddSection(kPath, "s", nullptr, 0), -2);
    fnRefused(TLIBCFileAddSection(kNo, "s", pHash, 0) + TLIBCFileAddSection(kPath, kNo, pHash, 0), -2);
    fnRefused(fnValue(kNo, "s", "k", szText, 9) + fnValue(kPath, kNo, "k", szText, 9), -2);
    fnRefused(fnValue(kPath, "s", kNo, szText, 9) + fnValue(kPath, "s", "k", nullptr, 9), -2);
    fnRefused(fnValue(kPath, "s", "k", szText, 0), -1);
    fnRefused(fnValue(kPath, "t", "k", szText, 9) + fnValue(kPath, "s", "l", szText, 9), -2, TLIBC_ERR_NOT_FOUND);
    fnRefused(TLIBCFileGetKeyValue(kNo, "k", szText, 9, 0) + TLIBCFileGetKeyValue(kKeys, kNo, szText, 9, 0), -2);
    fnRefused(TLIBCFileGetKeyValue(kKeys, "k", nullptr, 9, 0) + TLIBCFileGetKeyValue(kKeys, "k", szText, 0, 0), -2);
    fnRefused(TLIBCFileGetKeyValue(kKeys, "l", szText, 9, 0), -1, TLIBC_ERR_NOT_FOUND);
    fnRefused(TLIBCFileSetKeyValue(kNo, "k", "v", kNo) + TLIBCFileSetKeyValue(kKeys, "k", kNo, kNo), -2);
    fnRefused(fnSet(kNo, kNo) + fnSet("", kNo) + fnSet(" k", kNo) + fnSet("k=l", kNo), -4);
    fnRefused(fnSet("k", "%s") + fnSet("k", "%s=%s%s") + fnSet("k", "%s=%s\n%"), -3);
    fnRefused(TLIBCFileGetKeys(kNo, kNo, &pOut, "=") + TLIBCFileGetKeys(kKeys, kNo, nullptr, "="), -2);
    fnRefused(TLIBCFileGetKeys(kKeys, kNo, &pOut, kNo) + TLIBCFileGetKeys(kKeys, kNo, &pOut, ""), -2);
    fnRefused(fnNull(TLIBCSzHashAlloc(-1)) + TLIBCSzHashCount(nullptr), -2);
    fnRefused(TLIBCSzHashSetValue(nullptr, "k", "v") + TLIBCSzHashSetValue(pHash, kNo, "v"), -2);
    fnRefused(TLIBCSzHashSetValue(pHash, "", "v"), -1);
    fnRefused(fnNull(TLIBCSzHashGetValue(nullptr, "k")) + fnNull(TLIBCSzHashGetValue(pHash, kNo)), -2);
    fnRefused(fnNull(TLIBCSzListAlloc(-1)) + TLIBCSzListCount(nullptr), -2);
    fnRefused(TLIBCSzListPush(nullptr, "x") + TLIBCSzListPush(pList, kNo), -2);
    fnRefused(TLIBCIsProcAlive(kNo) + TLIBCIsProcAlive("") + TLIBCKill(kNo, 0) + TLIBCKill("", 0), -4);
    fnRefused(TLIBCKill("x", -1) + TLIBCKill("x", NSIG) + TLIBCReadPidFile(kNo) + TLIBCSystem(kNo), -4);
    fnRefused(TLIBCExec(kNo, kNo, kNo, kNo, kNo) + TLIBCExec("", kNo, kNo, kNo, kNo), -2);
    fnRefused(TLIBServiceIsRunning(kNo) + TLIBServiceIsRunning("") + TLIBServiceIsRunning("-x"), -3);
    fnRefused(TLIBServiceIsRunning(".x") + TLIBServiceIsRunning("a b") + TLIBServiceIsRunning((szMost + "n").c_str()),
              -3);
    fnRefused(TLIBServiceIsRunning(szMost.c_str()) + TLIBServiceReload("x") + TLIBServiceRestart("x"), -3,
              TLIBC_ERR_NOT_FOUND);
    fnRefused(TAVOLogSet1(2, 1, 1, "x", kNo, kNo, kNo) + TAVOLogSet1(1, 0, 1, "x", kNo, kNo, kNo), -2);
    fnRefused(TAVOLogSet1(1, 4, 1, "x", kNo, kNo, kNo) + TAVOWriteLog(kNo, 1, 1), -2);
    fnRefused(TAVOWriteLog("x", 2, 1) + TAVOWriteLog("x", 1, 0), -2);
    fnRefused(
        TAVONetIsSameSubnet(kNo, kIp, kIp) + TAVONetIsSameSubnet(kIp, kNo, kIp) + TAVONetIsSameSubnet(kIp, kIp, kNo),
        -3);
    fnRefused(
        TAVONetIsSameSubnet("x", kIp, kIp) + TAVONetIsSameSubnet(kIp, "x", kIp) + TAVONetIsSameSubnet(kIp, kIp, "x"),
        -3);
    fnRefused(TLIBNetGetInterfaceInfo(&card, 0, 1) + TAVONetGetCard1(-1, &card) + TAVONetGetCard1(0, nullptr), -3);
    fnRefused(checkGwIfEnable(nullptr, 9) + checkGwIfEnable(szText, 0) + TAVONetGatewayAsk(nullptr), -3);
    fnRefused(checkDefaultGatewaySetting(nullptr, 9) + checkDefaultGatewaySetting(szText, 0), -2);
    fnRefused(RouterDBList(nullptr) + TAVOPFRuleBuildByPath(nullptr, kNo) + TAVOPFRuleBuildByPath(nullptr, ""), -3);
    fnRefused(TAVOPFCountJobNumber(nullptr, kNo, "PF add port") + TAVOPFCountJobNumber(nullptr, kIp, kNo), -2);
    fnRefused(TAVOPFCountJobNumber(nullptr, kIp, "PF del port"), -1);
    EXPECT_STREQ(szText, "as it was");
    EXPECT_EQ(Read(kPath) + Read(kKeys), "[s]\nk=v\nk=v\n");
    EXPECT_EQ(fnNull(pOut) + fnNull(TLIBCSzListGet(nullptr, 0)) + fnNull(TLIBCSzListGet(pList, -1)), -3);
    EXPECT_TRUE(TLIBCSzListGet(pList, 1) == nullptr && TLIBCSzListGet(pList, 0) != nullptr);
    EXPECT_EQ(TLIBCSzHashGetAt(nullptr, 0, &szKey, &szValue) + TLIBCSzHashGetAt(pHash, -1, &szKey, &szValue), 0);
    EXPECT_EQ(TLIBCSzHashGetAt(pHash, 1, &szKey, &szValue) + TLIBCSzHashGetAt(pHash, 0, &szKey, &szValue), 1);
    EXPECT_EQ(TLIBCSzHashGetAt(pHash, 0, nullptr, &szValue) + TLIBCSzHashGetAt(pHash, 0, &szKey, nullptr), 0);
    EXPECT_EQ(fnValue(kPath, "s", "k", szText, 1) + TLIBCFileGetKeyValue(kKeys, "k", szText, 1, 0), 1);
    EXPECT_STREQ(szText, "");
    EXPECT_EQ(fnSet("k", "%s=%s%%\n") + TLIBCKill("nobody", NSIG - 1), 1);
    EXPECT_EQ(BlTLIBIsIpAddr(kNo) + BlTLIBIsIpAddr("") + BlTLIBIsIpAddr("1.2.3.4 ") + BlTLIBIsIpAddr(kIp), 1);
    EXPECT_EQ(TAVONetIsSameSubnet(kIp, "1.9.9.9", "255.0.0.0") - TAVONetIsSameSubnet(kIp, "2.1.1.1", "255.0.0.0"), 1);
    EXPECT_EQ(TAVOPFIsValidPortNo(0) + TAVOPFIsValidPortNo(1) + TAVOPFIsValidPortNo(65535) + TAVOPFIsValidPortNo(65536),
              2);
    TLIBCSzHashFree(pHash);
    TLIBCSzListFree(pList);
}

TEST(Process, APidFileHoldsTheNumberOfAProcess) {
    for (const auto& [szText, pid] : {std::pair<const char*, pid_t>{"1\n", 1},
                                      {"2147483647", INT32_MAX},
                                      {"0", -1},
                                      {"2147483648", -1},
                                      {"x", -1}}) {
        Write("/tmp/t/pid", szText);
        EXPECT_EQ(TLIBCReadPidFile("/tmp/t/pid"), pid) << szText;
    }
}

// Without systemd and with it: what is run for a service, by which name, and what becomes of its exit status.
TEST(Service, IsAskedForByTheSystemsNameAndItsManager) {
    constexpr char kUnit[] = "/etc/systemd/system/playedd.service";
    constexpr char kDaemon[] = "/usr/tavo/sbin/playedd";
    constexpr const char* kPrograms[] = {"/etc/init.d/avahi-daemon", "/etc/init.d/other", "/usr/local/sbin/systemctl"};
    for (const char* szProgram : kPrograms) {
        WriteProgram(szProgram, "echo ${0##*/} \"$@\" >> /tmp/t/said\nexit $(cat /tmp/t/exit)\n");
    }
    Write("/etc/tavo/platform.conf", "[services]\nplayed=\"other\"\nbad=\"-x\"\n");
    for (const int nCase : {0, 3, 10, 13}) {  // the exit status; of systemd from 10 on
        const bool blGood = nCase % 10 == 0;
        Write("/tmp/t/exit", std::to_string(nCase % 10));
        Write("/tmp/t/said", "");
        if (nCase >= 10) {
            std::filesystem::create_directories("/run/systemd/system");
        }
        EXPECT_EQ(TLIBServiceIsRunning("avahi"), blGood ? 1 : 0);
        EXPECT_EQ(TLIBServiceReload("avahi"), blGood ? 0 : -1);
        EXPECT_EQ(TLIBServiceRestart("played"), blGood ? 0 : -1);
        EXPECT_EQ(TLIBServiceRestart("bad"), -1);
        EXPECT_EQ(Read("/tmp/t/said"), nCase < 10 ? "avahi-daemon status\navahi-daemon reload\nother restart\n"
                                                  : "systemctl is-active avahi-daemon.service\nsystemctl reload "
                                                    "avahi-daemon.service\nsystemctl restart other.service\n");
        // A daemon of ours that has a unit is the manager's, but with arguments it is for whoever starts it.
        Write("/tmp/t/said", "");
        EXPECT_EQ(TLIBCExec(kDaemon, nullptr, nullptr, nullptr, nullptr), -1) << "neither unit nor program";
        Write(kUnit, "");
        EXPECT_EQ(TLIBCExec(kDaemon, "-x", nullptr, nullptr, nullptr), -1);
        EXPECT_EQ(TLIBCExec(kDaemon, nullptr, nullptr, nullptr, nullptr), nCase == 10 ? 0 : -1);
        EXPECT_EQ(Read("/tmp/t/said"),
                  nCase < 10 ? "" : "systemctl reset-failed playedd.service\nsystemctl start playedd.service\n");
        std::filesystem::remove(kUnit);
    }
    for (const char* szMade : {kPrograms[0], kPrograms[1], kPrograms[2], "/run/systemd", "/etc/tavo/platform.conf"}) {
        std::filesystem::remove_all(szMade);
    }
}

TEST(SectionedFile, AnyValueSurvivesAndOpensNothing) {
    std::string szBytes;
    for (int nByte = 1; nByte < 256; ++nByte) {
        szBytes += static_cast<char>(nByte);
    }
    const std::vector<std::string> rgValues = {
        "",      "plain", "two words",    "x\"; [192.168.1.1]\nuser=\"me", "\\", "\\\"", "a=b#c", "\r\n\t\x01\x7f",
        "ärger", "[x]",   "' $(id) `id`", std::string(10000, '"'),         "#x", " x ",  szBytes};
    std::filesystem::create_directories("/tmp/t");
    for (const std::string& szValue : rgValues) {
        for (const std::string& szName : {std::string("s"), szValue}) {
            std::filesystem::remove(kPath);
            TLIBCSzHash* pHash = TLIBCSzHashAlloc(4);
            TLIBCSzHashSetValue(pHash, "protocol name", szValue.c_str());
            if (!szValue.empty()) {
                TLIBCSzHashSetValue(pHash, szValue.c_str(), "by key");
            }
            ASSERT_EQ(TLIBCFileAddSection(kPath, szName.c_str(), pHash, 0), 1);
            ASSERT_EQ(TLIBCFileAddSection(kPath, "other", pHash, 0), 1);
            TLIBCSzHash* pRead = TLIBCSzHashAlloc(4);
            EXPECT_EQ(TLIBCFileGetSection(kPath, szName.c_str(), pRead), TLIBCSzHashCount(pHash)) << szValue;
            EXPECT_STREQ(TLIBCSzHashGetValue(pRead, "protocol name"), szValue.c_str());
            TLIBCSzHashFree(pRead);
            TLIBCSzHashFree(pHash);
            EXPECT_EQ(tavo::ParseSections(Read(kPath))->size(), 2U) << szValue;
        }
    }
    struct stat status = {};
    stat(kPath, &status);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
    EXPECT_EQ(tavo::FormatSections({{"a]", {{"k=", "\r\n\t\x01\x7f\"\\"}}}}),
              "[a\\x5d]\nk\\x3d=\"\\r\\n\\t\\x01\\x7f\\\"\\\\\"\n\n")
        << "as other programs read it";
}

TEST(SectionedFile, ReadsWhatPeopleWriteAndRefusesTheRest) {
    EXPECT_EQ(tavo::SplitLines("a\r\nb\rc\n\r\nd"), (std::vector<std::string_view>{"a", "b\rc", "", "d"}));
    EXPECT_EQ(tavo::ParseSections("# c\r\n\r\n [a] \r\nk = plain text \nq=\"x\" # c\n")->front().rgPairs[0].szValue,
              "plain text");
    EXPECT_EQ(tavo::ParseSections("[a]\nk=\"\\x09\\x4a\\x4A\\xAf\"\n")->front().rgPairs[0].szValue, "\tJJ\xaf");
    for (const char* szBad :
         {"k=v\n", "[a]\nnonsense\n", "[a]\nk=\"open\n", "[a]\nk=\"\\q\"\n", "[a]\nk=\"x\" y\n", "[a]\nk=\"\\x00\"\n",
          "[a]\n=v\n", "[a]\nk=\"\\x4\"\n", "[a]\nk=\"\\x4g\"\n", "[a]\nk=\"\\x@1\"\n", "[a]\nk=\"x\\\"\n",
          "[a]\nk\\=v\n", "[a\\]\nk=v\n", "[a\\q]\nk=v\n"}) {
        EXPECT_FALSE(tavo::ParseSections(szBad)) << szBad;
    }
}

TEST(SectionedFile, WhatNoReaderTakesIsNotWritten) {
    const std::string szOld = "[a]\nk=1\n";
    const std::string szHuge(16U << 20U, 'x');
    TLIBCSzHash* pHash = TLIBCSzHashAlloc(1);
    TLIBCSzHashSetValue(pHash, "k", szHuge.c_str());
    TAVO_PF_CONF conf = {"b", pHash, nullptr};
    std::vector<TAVO_PF_CONF> rgMany(TAVO_PF_MAX_SECTIONS + 1, TAVO_PF_CONF{"b", nullptr, nullptr});
    for (size_t i = 1; i < rgMany.size(); ++i) {
        rgMany[i - 1].pNext = &rgMany[i];
    }
    const std::pair<std::function<int()>, int> rgWrites[] = {
        {[&] { return TLIBCFileAddSection(kPath, "b", pHash, 0); }, TLIBC_ERR_WRITE},
        {[&] { return TAVOPFRuleBuildByPath(&conf, kPath); }, TLIBC_ERR_WRITE},
        {[&] { return TLIBCFileSetKeyValue(kPath, "k", szHuge.c_str(), nullptr); }, TLIBC_ERR_WRITE},
        {[&] { return TAVOPFRuleBuildByPath(rgMany.data(), kPath); }, TLIBC_ERR_BAD_PARAMETER}};
    EXPECT_EQ(TAVOPFRuleBuildByPath(&rgMany[1], kPath), 0) << "as many as are read again";
    for (const auto& [fnWrite, nErr] : rgWrites) {
        Write(kPath, szOld);
        EXPECT_LT(fnWrite(), 0);
        EXPECT_EQ(TLIBCErrGet(), nErr);
        EXPECT_TRUE(Read(kPath) == szOld);
    }
    TLIBCSzHashFree(pHash);
    // The most that there may be is read again.
    const std::string szMost = "[a]\nk=" + szHuge.substr(6);
    EXPECT_TRUE(tavo::WriteFileAtomic(kPath, szMost));
    EXPECT_TRUE(tavo::ReadFile(kPath) == szMost);
    EXPECT_FALSE(tavo::WriteFileAtomic(kPath, szMost + "x"));
}

TEST(SectionedFile, ASectionBegunAgainGoesOnAndNamesAreNeverCut) {
    const std::string szLong(2000, 'x');
    Write(kPath, "[a]\nk=1\n[a]\nk=2\nother=3\n[" + szLong + "1]\nk=4\n[" + szLong + "2]\nk=5\n");
    char szValue[8] = "kept";
    TLIBCSzHash* pHash = TLIBCSzHashAlloc(0);
    TLIBCSzHashSetValue(pHash, "k", "old");
    EXPECT_EQ(TLIBCFileGetSection(kPath, "absent", pHash), 0);
    EXPECT_EQ(TLIBCFileGetSection(kPath, "a", pHash), 3);
    EXPECT_STREQ(TLIBCSzHashGetValue(pHash, "k"), "2");
    EXPECT_EQ(TLIBCSzHashCount(pHash), 2);
    EXPECT_EQ(TLIBCFileGetSectionValue(kPath, "a", "other", szValue, sizeof(szValue)), 0);
    EXPECT_STREQ(szValue, "3");
    TLIBCSzHashSetValue(pHash, "k", "new");
    EXPECT_EQ(TLIBCFileAddSection(kPath, "a", pHash, 0), 1);
    EXPECT_EQ(TLIBCFileGetSectionValue(kPath, "a", "k", szValue, sizeof(szValue)), 0);
    EXPECT_STREQ(szValue, "new");
    EXPECT_EQ(tavo::ParseSections(Read(kPath))->size(), 3U);
    EXPECT_EQ(TLIBCFileGetSectionValue(kPath, (szLong + "2").c_str(), "k", szValue, sizeof(szValue)), 0);
    EXPECT_STREQ(szValue, "5");
    TLIBCSzHashFree(pHash);

    std::string szMany;
    for (int i = 0; i < 16384; ++i) {
        szMany += "[]\n";
    }
    for (const std::string& szText : {szMany, "[" + std::string(1023, 'x') + "]\n"}) {
        Write("/etc/portforward/rule.conf", szText);
        TAVO_PF_CONF* pConf = TAVOPFRuleGet();
        EXPECT_NE(pConf, nullptr) << szText.size();
        TAVOPFConfFree(pConf);
    }
    const std::string rgszRefused[] = {"[1]\nk=1\n[" + std::string(1024, 'x') + "]\nk=2\n", szMany + "[]\n",
                                       std::string("[1]\nk=\0\n", 8)};
    for (const std::string& szText : rgszRefused) {
        Write("/etc/portforward/rule.conf", szText);
        EXPECT_EQ(TAVOPFRuleGet(), nullptr);
        EXPECT_EQ(TLIBCErrGet(), TLIBC_ERR_FORMAT);
        EXPECT_EQ(Read("/etc/portforward/rule.conf"), szText);
    }
    EXPECT_TRUE(Logged("line 2: neither a section nor a key; the file is left alone and not used"));
    EXPECT_TRUE(Logged("too many sections, or a name over 1023 bytes; the file is left alone and not used"));
    std::filesystem::remove("/etc/portforward/rule.conf");
    EXPECT_EQ(TAVOPFRuleGet(), nullptr);
    EXPECT_EQ(TLIBCErrGet(), TLIBC_ERR_NOT_FOUND);
}

// The library logs all three: a place in a helper, or one on the machine that built it, leads nobody to the fault.
TEST(LastError, NamesThePlaceInTheTreeThatFailed) {
    const std::pair<std::function<void()>, const char*> rgCases[] = {
        {[] { TLIBCFileSetKeyValue(nullptr, "k", "v", nullptr); }, "platform/linux/core/File.cpp"},
        {[] { TAVONetGetCard1(0, nullptr); }, "platform/linux/net/Cards.cpp"},
        {[] { tavo::ReadFile("/tmp/t/nowhere"); }, "ground/TextFile.cpp"},
        {[] { TLIBCSzHashCount(nullptr); }, "platform/linux/core/Hash.cpp"},
        {[] { TLIBCSzListCount(nullptr); }, "platform/linux/core/Hash.cpp"}};
    int nLineBefore = 0;
    for (const auto& [fnFail, szFile] : rgCases) {
        TLIBCErrSet(TLIBC_ERR_NONE, nullptr, 0);
        fnFail();
        EXPECT_NE(TLIBCErrGet(), TLIBC_ERR_NONE) << szFile;
        EXPECT_STREQ(TLIBCErrorGetFile(), szFile);
        EXPECT_GT(TLIBCErrorGetLine(), 0) << szFile;
        EXPECT_NE(TLIBCErrorGetLine(), std::exchange(nLineBefore, TLIBCErrorGetLine())) << szFile;
    }
}

TEST(SystemLog, ALineStaysOneLineOfPlainText) {
    const char* rgszCases[][2] = {
        {"a\nb\r\t\x1b[2J\x7f", "a\\x0ab\\x0d\\x09\\x1b[2J\\x7f"},
        {"\xc2\x9b"
         "31m \xc3\xa4\xc2\xa0\\x",
         "\\x9b31m \xc3\xa4\xc2\xa0\\x"},
        {"\xc2", "\xc2"},
        {"\x1f ~\x7f\xc2\x7f\xc2\x80\xc2\x9f\xc3\x80", "\\x1f ~\\x7f\xc2\\x7f\\x80\\x9f\xc3\x80"}};
    for (const auto& rgszCase : rgszCases) {
        gLog.clear();
        errno = ENOTTY;
        tavo::SysLog(LOG_ERR, "say %s", rgszCase[0]);
        tavo::lib::LogError("say %s\n", rgszCase[0]);  // the library has a line that ends so
        EXPECT_EQ(gLog, (std::vector<std::string>{rgszCase[1], rgszCase[1] + std::string("\n")}));
        EXPECT_EQ(errno, ENOTTY);
    }
    gLog.clear();
    tavo::SysLog(LOG_ERR, "say %s", std::string(100000, '\n').c_str());
    EXPECT_EQ(gLog.front().substr(0, 8), "\\x0a\\x0a");
    // One that is longer than what is set aside for it is whole as long as there is memory.
    const std::string szLong(6000, 'x');
    for (const long nGood : {-1L, 0L}) {
        gLog.clear();
        gNGoodAllocations = nGood;
        tavo::lib::LogError("say %s", szLong.c_str());
        gNGoodAllocations = -1;
        ASSERT_EQ(gLog.size(), 1U);
        EXPECT_TRUE(nGood < 0 ? gLog.front() == szLong : gLog.front().size() > 2000);
    }
    // A value on its way through the platform.
    gLog.clear();
    Write("/tmp/t/a\nb", "no section\n");
    TLIBCSzHash* pHash = TLIBCSzHashAlloc(1);
    EXPECT_LT(TLIBCFileGetSection("/tmp/t/a\nb", "s", pHash), 0);
    TLIBCSzHashFree(pHash);
    EXPECT_EQ(gLog.front().find('\n'), std::string::npos);
}

TEST(KeyFile, ChangesOneLineAndCanBeSourced) {
    Write(kPath, "# kept\na=\"1\"\n  odd line\nb='2'\n");
    EXPECT_EQ(TLIBCFileSetKeyValue(kPath, "a", "x\"$(id)`id`\\", "%s=\"%s\"\n"), 1);
    EXPECT_EQ(TLIBCFileSetKeyValue(kPath, "c", "3", nullptr), 1);
    EXPECT_EQ(Read(kPath), "# kept\na=\"x\\\"\\$(id)\\`id\\`\\\\\"\n  odd line\nb='2'\nc=\"3\"\n");
    char szValue[64] = "untouched";
    EXPECT_GE(TLIBCFileGetKeyValue(kPath, "a", szValue, sizeof(szValue), 0), 1);
    EXPECT_STREQ(szValue, "x\"$(id)`id`\\");
    EXPECT_LT(TLIBCFileGetKeyValue(kPath, "absent", szValue, sizeof(szValue), 0), 0);
    EXPECT_LT(TLIBCFileSetKeyValue(kPath, "k", "v", "%s=%d\n"), 0);
}

TEST(KeyFile, TwoWritersLoseNothing) {
    std::filesystem::remove(kPath);
    const auto fnWrite = [](char cName) {
        for (int i = 0; i < 40; ++i) {
            TLIBCFileSetKeyValue(kPath, (std::string(1, cName) + std::to_string(i)).c_str(), "v", nullptr);
        }
    };
    std::thread other(fnWrite, 'a');
    fnWrite('b');
    other.join();
    TLIBCSzHash* pHash = nullptr;
    EXPECT_EQ(TLIBCFileGetKeys(kPath, nullptr, &pHash, "="), 80);
    TLIBCSzHashFree(pHash);
}

TEST(AtomicWrite, AFailureLeavesTheOldFileAndNothingElse) {
    std::filesystem::remove_all("/tmp/t");
    Write(kPath, "old");
    chmod(kPath, 0640);
    ASSERT_TRUE(tavo::WriteFileAtomic(kPath, "new"));
    struct stat status = {};
    stat(kPath, &status);
    EXPECT_EQ(status.st_mode & 0777U, 0640U);
    mkdir("/tmp/t/full", 0755);
    EXPECT_FALSE(tavo::WriteFileAtomic("/tmp/t/full", "text"));  // a directory is in the way
    EXPECT_EQ(Read(kPath), "new");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator("/tmp/t"), {}), 2);
    Write("/var/victim", "safe");
    symlink("/var/victim", "/tmp/trap");
    EXPECT_TRUE(tavo::WriteFileAtomic("/tmp/trap", "mine"));  // everybody's directory: no link is followed
    EXPECT_EQ(Read("/var/victim"), "safe");
}

// Of what others may have put where a lock of ours belongs: what comes of it, and what stands there then.
TEST(OwnFile, StandsWhereOthersHavePutSomethingOrItIsSaidThatItDoesNot) {
    static constexpr char kOwn[] = "/tmp/t/own";
    Write("/tmp/t/victim", "safe");
    const std::tuple<const char*, std::function<void()>, int> rgCases[] = {
        {"nothing", [] {}, 0},
        {"a link", [] { symlink("/tmp/t/victim", kOwn); }, 0},
        {"a second name of a file", [] { link("/tmp/t/victim", kOwn); }, 0},
        {"a pipe", [] { mkfifo(kOwn, 0666); }, 0},
        {"one that a group writes", [] { Write(kOwn, "theirs"), chmod(kOwn, 0620); }, 0},
        {"one that others write", [] { Write(kOwn, "theirs"), chmod(kOwn, 0602); }, 0},
        {"a disk that fails", [] { gNRenamesLeft = 0; }, EIO}};
    gBlKilled = false;
    for (const auto& [szWhat, fnPlant, nErrno] : rgCases) {
        std::filesystem::remove(kOwn);
        fnPlant();
        gLog.clear();
        EXPECT_EQ(tavo::MakeOwnFile(kOwn), nErrno == 0) << szWhat;
        EXPECT_EQ(Logged("was not ours alone; another file stands there now"),
                  nErrno == 0 && std::string(szWhat) != "nothing");
        EXPECT_TRUE(nErrno == 0 || errno == nErrno) << szWhat;
        struct stat status = {};
        EXPECT_EQ(lstat(kOwn, &status) == 0 && status.st_mode == (S_IFREG | 0600), nErrno == 0) << szWhat;
        EXPECT_EQ(Read("/tmp/t/victim"), "safe");
    }
    gBlKilled = true;
    gNRenamesLeft = -1;
    Write(kOwn, "held");  // by one of ours
    chmod(kOwn, 0600);
    EXPECT_TRUE(tavo::MakeOwnFile(kOwn));
    EXPECT_EQ(Read(kOwn), "held");
    EXPECT_FALSE(tavo::MakeOwnFile("/tmp/t/nowhere/own"));
}

TEST(Files, DirectoriesNamesAndLogs) {
    for (const auto& [szPath, szDir] : {std::pair("/a/b", "/a/"), {"/a", "/"}, {"a", "."}, {"a/b/", "a/b/"}}) {
        EXPECT_EQ(tavo::DirectoryOf(szPath), szDir);
    }
    for (const auto& [szPart, blGood] : {std::pair("", false),
                                         {".", false},
                                         {"..", false},
                                         {"a/b", false},
                                         {"/", false},
                                         {"...", true},
                                         {"a", true}}) {
        EXPECT_EQ(tavo::IsPathPart(szPart), blGood) << szPart;
    }
    EXPECT_EQ(tavo::PrintableText("\x1f a~\x7f\xff", 4), " a~\xff");
    EXPECT_EQ(tavo::PrintableText("abcd", 3), "abc");
    std::filesystem::remove_all("/tmp/t/made");
    const mode_t nMask = umask(0077);
    EXPECT_TRUE(tavo::MakeDirectory("/tmp/t/made"));
    umask(0);
    struct stat status = {};
    EXPECT_TRUE(stat("/tmp/t/made", &status) == 0 && (status.st_mode & 07777U) == 0755U);
    EXPECT_TRUE(tavo::MakeDirectory("/tmp/t/made")) << "it is there";
    EXPECT_FALSE(tavo::MakeDirectory("/tmp/t/none/made"));
    EXPECT_EQ(tavo::NamesIn("/tmp/t/made"), std::vector<std::string>());
    EXPECT_TRUE(tavo::AppendLogLine("/tmp/t/made/log", "one") && tavo::AppendLogLine("/tmp/t/made/log", "two"));
    umask(nMask);
    EXPECT_EQ(Read("/tmp/t/made/log"), "one\ntwo\n");
    EXPECT_TRUE(stat("/tmp/t/made/log", &status) == 0 && (status.st_mode & 07777U) == 0640U);
    symlink("/tmp/t/made/log", "/tmp/t/made/link");
    EXPECT_FALSE(tavo::AppendLogLine("/tmp/t/made/link", "three")) << "no link is followed";
    EXPECT_FALSE(tavo::AppendLogLine("/dev/full", "three")) << "not written";
    EXPECT_EQ(tavo::NamesIn("/tmp/t/made")->size(), 2U);
    EXPECT_EQ(tavo::NamesIn("/tmp/t/none"), std::nullopt);
    const std::string szTime = tavo::LogTime();
    EXPECT_TRUE(szTime.size() == 24 && szTime[10] == 'T') << szTime;
}

// No two neighbours of one kind, all three kinds, and a last one that follows from the others.
TEST(Suffix, IsWhatItsMakerMakesAndNothingThatAPersonWrites) {
    std::set<std::string> setMade;
    for (int i = 0; i < 200; ++i) {
        const std::string szMade = tavo::MakeSuffix();
        EXPECT_TRUE(tavo::IsSuffix(szMade)) << szMade;
        std::string szOther = szMade;
        szOther.back() =
            static_cast<char>(szMade.back() + (std::string("9zZ").find(szMade.back()) == szMade.npos ? 1 : -1));
        EXPECT_FALSE(tavo::IsSuffix(szOther)) << szOther;
        EXPECT_FALSE(tavo::IsSuffix(szMade + "a") || tavo::IsSuffix(szMade.substr(1))) << szMade;
        setMade.insert(szMade);
    }
    EXPECT_GT(setMade.size(), 195U);
    for (const char* szSuffix : {"backup", "0a0a0a", "a0B1-2", "aA0a0A", "20240101"}) {
        EXPECT_EQ(tavo::IsSuffix(szSuffix), false) << szSuffix;
    }
    EXPECT_TRUE(tavo::IsSuffix("0aA0aF")) << "as those that lie on users' disks are";
}

TEST(FileLock, WaitsForAsLongAsItIsTold) {
    const tavo::FileLock held("/tmp/t/lock");
    ASSERT_TRUE(held.Try());
    const tavo::FileLock other("/tmp/t/lock");
    int nAsked = 0;
    EXPECT_FALSE(other.Wait([&] { return ++nAsked < 3; }));
    EXPECT_EQ(nAsked, 3);
    EXPECT_FALSE(other.Try(LOCK_SH));
    tavo::FileLock nowhere("/tmp/t/none/lock");
    EXPECT_FALSE(nowhere.IsOpen() || nowhere.Try() || nowhere.Wait([] { return true; }));
    struct stat status = {};
    EXPECT_TRUE(stat("/tmp/t/lock", &status) == 0 && (status.st_mode & 07777U) == 0600U);
}

// The box's side of the compatibility test: what is written is read, and an order reaches a daemon that lives.
TEST(TestRules, AreReadBackAndOrdersAreBounded) {
    EXPECT_TRUE(tavo::RemoveTestRules()) << "there are none";
    EXPECT_TRUE(tavo::LoadTestRules().empty());
    EXPECT_TRUE(tavo::SaveTestRules({{1, 65535, true, "1"}, {65535, 2, false, "718"}}));
    const auto rgRules = tavo::LoadTestRules();
    ASSERT_EQ(rgRules.size(), 2U);
    EXPECT_EQ(std::tuple(rgRules[0].nRouterPort, rgRules[0].nBoxPort, rgRules[0].blKept, rgRules[0].szResult),
              std::tuple(1, 65535, true, "1"));
    EXPECT_EQ(std::tuple(rgRules[1].nRouterPort, rgRules[1].nBoxPort, rgRules[1].blKept, rgRules[1].szResult),
              std::tuple(65535, 2, false, "718"));
    EXPECT_TRUE(tavo::RemoveTestRules());
    EXPECT_TRUE(tavo::LoadTestRules().empty());
    for (const auto& [szWord, blUnderWay] : {std::pair("processing", true), {"finished", false}, {"", false}}) {
        Write(tavo::kTestProgress, std::string("upnp_add=\"") + szWord + "\"\n");
        EXPECT_EQ(tavo::IsStepUnderWay("upnp_add"), blUnderWay) << szWord;
    }
    EXPECT_FALSE(tavo::IsStepUnderWay("upnp_delete"));
    std::filesystem::remove(tavo::kTestProgress);

    gStage = Stage();
    gStage.blOn = true;
    const JumpingClock clock;
    const auto fnSeconds = [](const std::function<void()>& fnCall) {
        const time_t nStart = gNClockJumped;
        gNClockStep = 1;
        fnCall();
        gNClockStep = 0;
        return gNClockJumped - nStart;
    };
    EXPECT_EQ(fnSeconds([] { EXPECT_FALSE(tavo::SendTestOrder("delete")); }), 1) << "nobody is waited for";
    gStage.alive.insert(tavo::kTestDaemon);
    EXPECT_NEAR(static_cast<double>(fnSeconds([] { EXPECT_FALSE(tavo::SendTestOrder("delete")); })), 3.5, 0.6);
    sockaddr_un own = {};
    own.sun_family = AF_UNIX;
    snprintf(own.sun_path, sizeof(own.sun_path), "%s", tavo::kTestSocket);
    std::filesystem::create_directories("/var/run");
    const tavo::Descriptor fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    ASSERT_EQ(bind(fd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)), 0);
    const auto fnHeard = [&] {
        char szOrder[20] = {};
        return recv(fd.Get(), szOrder, sizeof(szOrder) - 1, 0) < 0 ? "" : std::string(szOrder);
    };
    EXPECT_TRUE(tavo::SendTestOrder("modify"));
    EXPECT_EQ(fnHeard(), "modify");
    EXPECT_NEAR(static_cast<double>(fnSeconds([] { tavo::EndTestDaemon(); })), 13.5, 0.6) << "it does not end";
    EXPECT_EQ(fnHeard(), "end");
    gStage = Stage();
    unlink(tavo::kTestSocket);
}

TEST(Process, IsFoundByNameScriptOrCommandLineUntilItEnds) {
    WriteProgram("/tmp/t/testupnp.sh", "while :; do /bin/sleep 1; done\n");
    EXPECT_EQ(TLIBCIsProcAlive("testupnp.sh"), 0);
    const int fd = open("/tmp/t/held", O_RDWR | O_CREAT, 0600);  // deliberately inheritable
    ASSERT_EQ(TLIBCExec("/tmp/t/testupnp.sh", "--one", nullptr, nullptr, nullptr), 0);
    // The kernel tells of the program's start a moment before it shows its name.
    EXPECT_TRUE(SoonTrue([] { return TLIBCIsProcAlive("testupnp.sh") == 1; }));
    EXPECT_EQ(TLIBCIsProcAlive("/bin/sh /tmp/t/testupnp.sh --one"), 1);
    EXPECT_EQ(TLIBCIsProcAlive("/bin/sh /tmp/t/testupnp.sh"), 0);
    const std::string szPids =
        "for p in /proc/[0-9]*; do grep -qs testupnp.sh $p/cmdline && ls -l $p/fd; done "
        "2>/dev/null | grep -q /tmp/t/held";
    EXPECT_NE(TLIBCSystem(szPids.c_str()), 0);
    close(fd);
    EXPECT_GE(TLIBCKill("testupnp.sh", SIGKILL), 1);  // 2 where it has just forked and not yet become sleep
    EXPECT_TRUE(SoonTrue([] { return TLIBCIsProcAlive("testupnp.sh") == 0; }));
    EXPECT_EQ(TLIBCExec("/tmp/t/none", nullptr, nullptr, nullptr, nullptr), -1);
    EXPECT_EQ(TLIBCSystem("exit 3"), 3);
}

// A daemon that ignored or blocked what its starter did would not hear of new rules.
TEST(Process, WhatIsStartedHearsEverySignal) {
    std::filesystem::remove("/tmp/t/signals");
    sigset_t all, before;
    sigfillset(&all);
    sigprocmask(SIG_SETMASK, &all, &before);
    signal(SIGHUP, SIG_IGN);
    EXPECT_EQ(TLIBCExec("/bin/sh", "-c",
                        "/bin/grep -E 'Sig(Blk|Ign)' /proc/self/status > /tmp/t/s && mv /tmp/t/s /tmp/t/signals",
                        nullptr, nullptr),
              0);
    signal(SIGHUP, SIG_DFL);
    sigprocmask(SIG_SETMASK, &before, nullptr);
    SoonTrue([] { return std::filesystem::exists("/tmp/t/signals"); });
    EXPECT_EQ(Read("/tmp/t/signals"), "SigBlk:\t0000000000000000\nSigIgn:\t0000000000000000\n");
}

TEST(Process, StartsAreReportedTrulyInOddCallers) {
    int rgFdKept[2] = {dup(0), dup(1)};
    close(0);
    close(1);  // the pipe that reports a failed start gets these two
    const int nAbsent = TLIBCExec("/tmp/t/none", nullptr, nullptr, nullptr, nullptr);
    dup2(rgFdKept[0], 0);
    dup2(rgFdKept[1], 1);
    close(rgFdKept[0]);
    close(rgFdKept[1]);
    EXPECT_EQ(nAbsent, -1);
    signal(SIGCHLD, SIG_IGN);  // as many a daemon does: no status of a child is kept
    EXPECT_EQ(TLIBCExec("/bin/true", nullptr, nullptr, nullptr, nullptr), 0);
    EXPECT_EQ(TLIBCExec("/tmp/t/none", nullptr, nullptr, nullptr, nullptr), -1);
    EXPECT_EQ(TLIBCSystem("true"), 255);
    signal(SIGCHLD, SIG_DFL);
}

TEST(Hooks, AreRunOnlyWhereNobodyButRootOwnsThem) {
    const std::string szDirectory = "/tmp/t/hooks";
    std::filesystem::create_directories(szDirectory);
    Write(szDirectory + "/10-a", "");
    chmod((szDirectory + "/10-a").c_str(), 0755);
    for (const auto& [szForeign, szRefused] : {std::pair(std::string("/none"), std::string()),
                                               {szDirectory + "/10-a", szDirectory + "/10-a: "},
                                               {szDirectory, szDirectory + ": "}}) {
        gSzForeign = szForeign;
        std::vector<std::string> rgszRefused;
        const auto rgszHooks = tavo::FindHooks(szDirectory, rgszRefused);
        gSzForeign.clear();
        EXPECT_EQ(rgszHooks, szRefused.empty() ? std::vector<std::string>{"10-a"} : std::vector<std::string>());
        EXPECT_EQ(rgszRefused, szRefused.empty() ? std::vector<std::string>()
                                                 : std::vector{szRefused + "others than root may change it"});
    }
}

TEST(RouterDatabase, ARefreshThatIsKilledOrFailsLosesNothing) {
    const std::string szDatabase = "/etc.defaults/portforward/routerdb";
    WriteProgram("/usr/tavo/bin/wget", "cp /tmp/t/new.tgz \"$3\"\n");
    Write("/etc/tavo/platform.conf", "[download]\ndatabase_url=\"http://192.0.2.1\"\n");
    const auto fnMake = [](const std::string& szPlace, int nEdition) {
        Write(szPlace + "/version", "version=\"" + std::to_string(nEdition) + "\"\n");
        Write(szPlace + "/A/B/1/router.des", "[global]\nsyntax version=\"1\"\n");
    };
    fnMake("/tmp/t/new", 8);
    ASSERT_EQ(TLIBCSystem("tar -C /tmp/t/new -czf /tmp/t/new.tgz ."), 0);
    for (const bool blExchanges : {true, false}) {
        int nStatus = SIGKILL;
        for (int nRenames = 0; !WIFEXITED(nStatus); ++nRenames) {
            std::filesystem::remove_all(szDatabase);
            fnMake(szDatabase, 7);
            const pid_t pid = fork();
            if (pid == 0) {
                gBlExchanges = blExchanges;
                gNRenamesLeft = nRenames;
                _exit(TAVOPFRouterDBUpdate() == 8 ? 0 : 1);
            }
            waitpid(pid, &nStatus, 0);
            TLIBCSzList* pList = nullptr;
            EXPECT_EQ(RouterDBList(&pList), 1) << blExchanges << nRenames;
            TLIBCSzListFree(pList);
            EXPECT_EQ(TAVOPFRouterDBUpdate(), 8) << "and the next refresh does what this one was to do";
            ASSERT_LT(nRenames, 9);
        }
        EXPECT_EQ(WEXITSTATUS(nStatus), 0);
    }
    int nFailed = 0;
    gBlKilled = false;
    for (const int nCase : {0, 1, 2, 3, 10, 11, 12, 13}) {  // the first to fourth rename, with an exchange and without
        fnMake(szDatabase, 7);
        gBlExchanges = nCase < 10;
        gNRenamesLeft = nCase % 10;
        const int nEdition = TAVOPFRouterDBUpdate();
        nFailed += nEdition < 0 ? 1 : 0;
        EXPECT_EQ(nEdition < 0, *TAVOPFRouterDBWhy() != '\0') << nCase;
        EXPECT_EQ(Read(szDatabase + "/version"), nEdition == 8 ? "version=\"8\"\n" : "version=\"7\"\n") << nCase;
    }
    EXPECT_EQ(nFailed, 2);
    gBlKilled = gBlExchanges = true;
    gNRenamesLeft = -1;
    const auto fnEntries = [] {
        return std::distance(std::filesystem::directory_iterator("/etc.defaults/portforward"), {});
    };
    EXPECT_GT(fnEntries(), 1) << "of a refresh that may still go on, nothing is touched";
    gNClockAhead = 3600;
    EXPECT_EQ(TAVOPFRouterDBUpdate(), 8);
    gNClockAhead = 0;
    EXPECT_EQ(fnEntries(), 1);
    for (const char* szPlace : {"/etc.defaults/portforward", "/etc/tavo/platform.conf", "/usr/tavo/bin/wget"}) {
        std::filesystem::remove_all(szPlace);
    }
}

TEST(RunKeys, AreOnByTheWholeWordOnly) {
    for (const auto& [szConf, blOn] :
         {std::pair{"k=\"yes\"\n", true}, {"k=\"no\"\n", false}, {"k=\"yes!\"\n", false}, {"", false}}) {
        Write("/etc/tavoinfo.conf", szConf);
        EXPECT_EQ(tavo::IsRunKeyOn("k"), blOn) << szConf;
    }
    std::filesystem::remove("/etc/tavoinfo.conf");
}

}  // namespace
