// The task records: what survives, what is no record, and which names are none.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include "tavo/task.h"
#include "world.h"

namespace {

constexpr char kRecord[] = "/var/lib/tavo/tasks/@system/.upnp_detector.json";
constexpr char kHostile[] = "x\"; [192.168.1.1]\r\nbrand=\"y\\\"\t\xff\xc3\x01";

std::string Property(const char* szName) {
    NOS::Task task("@system", ".upnp_detector");
    task.reload();
    return task.getStringProperty(szName, "none");
}

TEST(Task, IsReplacedOnlyWhenAnUpdateEnds) {
    NOS::TaskMgr manager("@system");
    std::filesystem::remove_all("/var/lib/tavo");
    EXPECT_EQ(std::unique_ptr<NOS::Task>(manager.getTask(".upnp_detector")), nullptr);
    const mode_t nMask = umask(077);
    std::unique_ptr<NOS::Task> pTask(manager.createTask(".upnp_detector"));
    umask(nMask);
    ASSERT_NE(pTask, nullptr);
    EXPECT_EQ(std::filesystem::status(kRecord).permissions(), std::filesystem::perms(0644));
    EXPECT_EQ(std::filesystem::status("/var/lib/tavo/tasks/@system").permissions(), std::filesystem::perms(0755));

    const std::string szLong(10000, '"');
    EXPECT_EQ(pTask->endUpdate(), 0);
    EXPECT_EQ(pTask->beginUpdate(), 1);
    EXPECT_EQ(pTask->beginUpdate(), 0);
    EXPECT_EQ(pTask->setProperty("router_brand", kHostile), 1);
    EXPECT_EQ(pTask->setProperty(kHostile, szLong.c_str()), 1);
    EXPECT_EQ(pTask->setProperty("", "x") + pTask->setProperty(nullptr, "x") + pTask->setProperty("x", nullptr), 0);
    EXPECT_EQ(Property("router_brand"), "none");
    EXPECT_EQ(pTask->endUpdate(), 1);
    EXPECT_EQ(Property("router_brand"), kHostile);
    EXPECT_EQ(Property(kHostile), szLong);

    const pid_t nChild = fork();
    if (nChild == 0) {  // dies in the middle of the next update
        pTask->remove();
        pTask->beginUpdate();
        pTask->setProperty("router_brand", "new");
        _exit(0);
    }
    waitpid(nChild, nullptr, 0);
    EXPECT_EQ(Property("router_brand"), kHostile);
    pTask->remove();
    pTask->beginUpdate();
    EXPECT_EQ(pTask->endUpdate(), 1);
    EXPECT_EQ(Property("router_brand"), "none");
    EXPECT_NE(std::unique_ptr<NOS::Task>(manager.getTask(".upnp_detector")), nullptr);
}

TEST(Task, AFailedWriteLeavesTheRecord) {
    std::unique_ptr<NOS::Task> pTask(NOS::TaskMgr("@system").createTask(".upnp_detector"));
    const std::string szBefore = Read(kRecord);
    pTask->beginUpdate();
    pTask->setProperty("huge", std::string(2U << 20U, 'x').c_str());
    EXPECT_EQ(pTask->endUpdate(), 0);
    EXPECT_EQ(Read(kRecord), szBefore);
}

TEST(Task, WhatNobodyHereHasWrittenIsNoRecord) {
    const std::string rgBad[] = {"",
                                 "nonsense",
                                 "[]",
                                 "null",
                                 "{\"a\":1}",
                                 "{\"a\":\"x\",\"b\":null}",
                                 "{\"a\":{\"b\":\"c\"}}",
                                 "{\"a\":\"x\",\"a\":\"y\"}",
                                 "{\"a\":\"x\"} {}",
                                 "{\"a\":\"\\u0000\"}",
                                 "{\"a\":\"x\"",
                                 std::string(100000, '['),
                                 "{\"a\":\"" + std::string(2U << 20U, 'x') + "\"}"};
    for (const std::string& szText : rgBad) {
        Write(kRecord, "{\"a\":\"x\"}");
        NOS::Task task("@system", ".upnp_detector");
        ASSERT_EQ(task.reload(), 1);
        Write(kRecord, szText);
        EXPECT_EQ(task.reload(), 0) << szText.substr(0, 40);
        EXPECT_EQ(task.getStringProperty("a", "none"), "none") << szText.substr(0, 40);
    }
}

TEST(Task, NoNameLeadsOutOfTheDirectory) {
    Write("/var/lib/tavo/victim.json", "{\"a\":\"x\"}");
    const std::string szLong(201, 'x');
    for (const char* szBad :
         {"", ".", "..", "../tavo", "a/b", "/", "a\nb", "\x7f", szLong.c_str(), static_cast<const char*>(nullptr)}) {
        NOS::TaskMgr good("@system");
        NOS::TaskMgr bad(szBad);
        EXPECT_EQ(std::unique_ptr<NOS::Task>(good.createTask(szBad)), nullptr);
        EXPECT_EQ(std::unique_ptr<NOS::Task>(bad.createTask("id")), nullptr);
    }
    EXPECT_EQ(NOS::Task("..", "victim").reload(), 0);
    EXPECT_EQ(NOS::Task("@system", "../../victim").reload(), 0);
    EXPECT_NE(std::unique_ptr<NOS::Task>(NOS::TaskMgr("@system").createTask(szLong.substr(1).c_str())), nullptr);
}

}  // namespace
