// What a program still does when it is told to end. Relies on a thread that waits for what a signal handler may only
// note. Promises: one answer: once the function runs, what stood beside it does not go on to another.
#pragma once

#include <functional>
#include <thread>

namespace tavo::cli {

// While it lives, SIGINT, SIGTERM and SIGHUP run fnEnd in a thread of its own and end the program with its answer; a
// second one ends the program at once.
class OnSignal {
public:
    explicit OnSignal(std::function<int()> fnEnd);
    ~OnSignal();
    OnSignal(const OnSignal&) = delete;
    OnSignal& operator=(const OnSignal&) = delete;

private:
    void Watch(int fd) const;

    std::function<int()> mFnEnd;
    std::thread mThread;
};

}  // namespace tavo::cli
