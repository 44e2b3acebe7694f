// The platform: files that survive any value and any failure, processes, port lists, the database.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstdio>
#include <functional>
#include <thread>
#include <utility>

#include "ground/OwnFile.h"
#include "ground/PortText.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "programs/tavohook/Hooks.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "tavo/portforward.h"
#include "world.h"

namespace {

constexpr char kPath[] = "/tmp/t/file";

TEST(SectionedFile, AnyValueSurvivesAndOpensNothing) {
    const std::vector<std::string> rgValues = {"",      "plain", "two words",    "x\"; [192.168.1.1]\nuser=\"me",
                                               "\\",    "\\\"",  "a=b#c",        "\r\n\t\x01\x7f",
                                               "ärger", "[x]",   "' $(id) `id`", std::string(10000, '"')};
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
}

TEST(SectionedFile, ReadsWhatPeopleWriteAndRefusesTheRest) {
    EXPECT_EQ(tavo::ParseSections("# c\r\n\r\n [a] \r\nk = plain text \nq=\"x\" # c\n")->front().rgPairs[0].szValue,
              "plain text");
    for (const char* szBad : {"k=v\n", "[a]\nnonsense\n", "[a]\nk=\"open\n", "[a]\nk=\"\\q\"\n", "[a]\nk=\"x\" y\n",
                              "[a]\nk=\"\\x00\"\n", "[a]\n=v\n"}) {
        EXPECT_FALSE(tavo::ParseSections(szBad)) << szBad;
    }
}

TEST(SectionedFile, WhatNoReaderTakesIsNotWritten) {
    const std::string szOld = "[a]\nk=1\n";
    const std::string szHuge(16U << 20U, 'x');
    TLIBCSzHash* pHash = TLIBCSzHashAlloc(1);
    TLIBCSzHashSetValue(pHash, "k", szHuge.c_str());
    TAVO_PF_CONF conf = {"b", pHash, nullptr};
    const std::function<int()> rgWrites[] = {[&] { return TLIBCFileAddSection(kPath, "b", pHash, 0); },
                                             [&] { return TAVOPFRuleBuildByPath(&conf, kPath); },
                                             [&] { return TLIBCFileSetKeyValue(kPath, "k", szHuge.c_str(), nullptr); }};
    for (const auto& fnWrite : rgWrites) {
        Write(kPath, szOld);
        EXPECT_LT(fnWrite(), 0);
        EXPECT_EQ(TLIBCErrGet(), TLIBC_ERR_WRITE);
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
    for (int i = 0; i < 20000; ++i) {
        szMany += "[]\n";
    }
    const std::string rgszRefused[] = {"[1]\nk=1\n[" + std::string(1024, 'x') + "]\nk=2\n", szMany,
                                       std::string("[1]\nk=\0\n", 9)};
    for (const std::string& szText : rgszRefused) {
        Write("/etc/portforward/rule.conf", szText);
        EXPECT_EQ(TAVOPFRuleGet(), nullptr);
        EXPECT_EQ(TLIBCErrGet(), TLIBC_ERR_FORMAT);
        EXPECT_EQ(Read("/etc/portforward/rule.conf"), szText);
    }
    EXPECT_TRUE(Logged("line 2: neither a section nor a key; the file is left alone and not used"));
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
    const char* rgszCases[][2] = {{"a\nb\r\t\x1b[2J\x7f", "a\\x0ab\\x0d\\x09\\x1b[2J\\x7f"},
                                  {"\xc2\x9b"
                                   "31m \xc3\xa4\xc2\xa0\\x",
                                   "\\x9b31m \xc3\xa4\xc2\xa0\\x"},
                                  {"\xc2", "\xc2"}};
    for (const auto& rgszCase : rgszCases) {
        gLog.clear();
        tavo::SysLog(LOG_ERR, "say %s", rgszCase[0]);
        EXPECT_EQ(gLog, std::vector<std::string>{rgszCase[1]});
    }
    gLog.clear();
    tavo::SysLog(LOG_ERR, "say %s", std::string(100000, '\n').c_str());
    EXPECT_EQ(gLog.front().substr(0, 8), "\\x0a\\x0a");
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
        {"one that others write", [] { Write(kOwn, "theirs"), chmod(kOwn, 0666); }, 0},
        {"a disk that fails", [] { gNRenamesLeft = 0; }, EIO}};
    gBlKilled = false;
    for (const auto& [szWhat, fnPlant, nErrno] : rgCases) {
        std::filesystem::remove(kOwn);
        fnPlant();
        EXPECT_EQ(tavo::MakeOwnFile(kOwn), nErrno == 0) << szWhat;
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

TEST(Process, IsFoundByNameScriptOrCommandLineUntilItEnds) {
    Write("/tmp/t/testupnp.sh", "#!/bin/sh\nwhile :; do /bin/sleep 1; done\n");
    chmod("/tmp/t/testupnp.sh", 0755);
    EXPECT_EQ(TLIBCIsProcAlive("testupnp.sh"), 0);
    const int fd = open("/tmp/t/held", O_RDWR | O_CREAT, 0600);  // deliberately inheritable
    ASSERT_EQ(TLIBCExec("/tmp/t/testupnp.sh", "--one", nullptr, nullptr, nullptr), 0);
    EXPECT_EQ(TLIBCIsProcAlive("testupnp.sh"), 1);
    EXPECT_EQ(TLIBCIsProcAlive("/bin/sh /tmp/t/testupnp.sh --one"), 1);
    EXPECT_EQ(TLIBCIsProcAlive("/bin/sh /tmp/t/testupnp.sh"), 0);
    const std::string szPids =
        "for p in /proc/[0-9]*; do grep -qs testupnp.sh $p/cmdline && ls -l $p/fd; done "
        "2>/dev/null | grep -q /tmp/t/held";
    EXPECT_NE(TLIBCSystem(szPids.c_str()), 0);
    close(fd);
    EXPECT_GE(TLIBCKill("testupnp.sh", SIGKILL), 1);  // 2 where it has just forked and not yet become sleep
    for (int i = 0; i < 500 && TLIBCIsProcAlive("testupnp.sh") == 1; ++i) {
        usleep(10000);
    }
    EXPECT_EQ(TLIBCIsProcAlive("testupnp.sh"), 0);
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
    for (int i = 0; i < 500 && !std::filesystem::exists("/tmp/t/signals"); ++i) {
        usleep(10000);
    }
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
    Write("/usr/tavo/bin/wget", "#!/bin/sh\ncp /tmp/t/new.tgz \"$3\"\n");
    chmod("/usr/tavo/bin/wget", 0755);
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

}  // namespace
