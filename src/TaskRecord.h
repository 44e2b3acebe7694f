// The records in which the detectors keep what they found. Relies on the platform's tasks. Promises: readers see a
// whole finding or none.
#pragma once

#include <string>

#include "tavo/task.h"

namespace tavo::lib {

inline constexpr char kTaskOwner[] = "@system";

// One update of a task record: emptied and begun here, published by End(). Without End(), on the way of
// something thrown, it is published empty: half of a finding would be taken for a whole one.
class TaskUpdate {
public:
    explicit TaskUpdate(NOS::Task& task);
    ~TaskUpdate();
    TaskUpdate(const TaskUpdate&) = delete;
    TaskUpdate& operator=(const TaskUpdate&) = delete;

    // Throws when memory runs out.
    void Set(const char* szName, const char* szValue);
    // False, and logged: readers see what the last update published.
    bool End();

private:
    NOS::Task& mTask;
    bool mBlEnded = false;
};

// One text of a record of kTaskOwner's, read anew; empty when there is none.
std::string TaskText(const char* szId, const char* szName);

}  // namespace tavo::lib
