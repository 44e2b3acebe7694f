// A stage for the saving of rules: while it is set, processes, signals, commands, services and events are
// played, chosen platform calls fail, and what happens is told in gLog, between the log lines.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <set>
#include <string>

struct Stage {
    bool blOn = false;
    std::string szFail;  // the call that fails, after nWorks of them that do not
    int nWorks = 0;
    std::set<std::string> alive;                    // processes
    bool blStillborn = false;                       // what is started ends at once
    bool blRelay = true;                            // the relay service runs
    std::string szLocation = "http://h/d";          // where the databases are
    std::function<void(const std::string&)> fnRun;  // what a command does
};
extern Stage gStage;

// Begins and ends with nothing played: no stage, no network, the usual gateway, an empty log.
class StagedTest : public testing::Test {
protected:
    void SetUp() override;
    void TearDown() override { StagedTest::SetUp(); }
};

// A line of the story.
void Tell(const std::string& szLine);
