/*
 * The task manager: small records of named texts that outlive the process which wrote them and can be
 * read by any other. One record per owner and id.
 *
 * A record changes on disk only when an update ends, whole and at once: a writer that is killed in
 * between, or an update that never ends, leaves the record as it was. Nothing is thrown; null pointers,
 * and owners and ids that are no plain file name of at most 200 printable bytes, are bad input and
 * answered with the failure value.
 */
#ifndef TAVO_TASK_H
#define TAVO_TASK_H

#include <memory>
#include <string>

#pragma GCC visibility push(default)
namespace NOS {

/* A handle on one record. */
class Task {
public:
    /* Opens the record of szOwner and szId, which need not exist; reads nothing before reload(). */
    Task(const char* szOwner, const char* szId);
    ~Task();
    Task(const Task&) = delete;
    Task& operator=(const Task&) = delete;

    /* Reads what is on disk. 1: read; 0: there is no such record, or it cannot be read: the handle is empty. */
    int reload();
    /* Empties the handle; readers see the emptied record once the next update has ended. Always 1. */
    int remove();
    /* Begins an update. 1: begun; 0: one is under way. */
    int beginUpdate();
    /* Sets one text, inside an update or outside of one. 1: set; 0: bad input or no memory. */
    int setProperty(const char* szName, const char* szValue);
    /* Publishes the handle's contents. 1: written; 0: no update was under way, or the write failed and
     * the old record stands. */
    int endUpdate();
    /* The text of szName, or szDefault when there is none. */
    std::string getStringProperty(const char* szName, const char* szDefault) const;

private:
    struct Impl;
    std::unique_ptr<Impl> mPImpl;
};

/* The records of one owner. */
class TaskMgr {
public:
    explicit TaskMgr(const char* szOwner);
    ~TaskMgr();
    TaskMgr(const TaskMgr&) = delete;
    TaskMgr& operator=(const TaskMgr&) = delete;

    /* The record, read; the caller deletes it. NULL: there is none. */
    Task* getTask(const char* szId);
    /* A new, empty record, on disk at once; the caller deletes it. NULL: it could not be written. */
    Task* createTask(const char* szId);

private:
    struct Impl;
    std::unique_ptr<Impl> mPImpl;
};

}  // namespace NOS
#pragma GCC visibility pop
#endif
