// The detectors' records. Promises: see TaskRecord.h.
#include "TaskRecord.h"

#include <new>

#include "Border.h"
#include "Log.h"
#include "tavo/core.h"

namespace tavo::lib {

TaskUpdate::TaskUpdate(NOS::Task& task) : mTask(task) {
    mTask.remove();
    mTask.beginUpdate();
}

TaskUpdate::~TaskUpdate() {
    if (!mBlEnded) {
        mTask.remove();
        End();
    }
}

void TaskUpdate::Set(const char* szName, const char* szValue) {
    if (mTask.setProperty(szName, szValue) == 0) {
        throw std::bad_alloc();
    }
}

bool TaskUpdate::End() {
    mBlEnded = true;
    return mTask.endUpdate() != 0 ||
           Refuse("%s:%d the result of the detection could not be stored[0x%04X %s:%d]", kCommonFile, __LINE__,
                  static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
}

std::string TaskText(const char* szId, const char* szName) {
    return AtBorder(std::string(), [&] {
        NOS::Task task(kTaskOwner, szId);
        task.reload();
        return task.getStringProperty(szName, "");
    });
}

}  // namespace tavo::lib
