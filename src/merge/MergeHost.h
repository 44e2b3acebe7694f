// What the merge asks of whoever runs it, and whom it tells. Relies on nothing. Promises: a host answers and writes
// down, and decides nothing.
#pragma once

#include <cstdarg>

namespace tavo::lib {

// The file that every log line of the relay service's part names.
inline constexpr char kHopLinkFile[] = "src/libtavoportmapForHopLink.cpp";

class MergeHost {
public:
    virtual ~MergeHost() = default;

    // One line of the system log. Every format begins "%s:%d ": kHopLinkFile, then the line.
    void LogError(const char* szFormat, ...) const __attribute__((format(printf, 2, 3))) {
        va_list arguments;
        va_start(arguments, szFormat);
        Log(szFormat, arguments);
        va_end(arguments);
    }
    virtual bool IsValidPortNo(int nPort) const = 0;

private:
    virtual void Log(const char* szFormat, va_list arguments) const = 0;
};

struct OPERATION_RULE;

// Told what becomes of pairs as it is decided, in the order of the passes.
class MergeObserver {
public:
    virtual ~MergeObserver() = default;

    // The pair goes: pDecider has it, or, null, no rule does where one should; or another host holds the port.
    virtual void OnRemoved(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort,
                           const OPERATION_RULE* pDecider) = 0;
    // The merge fails: decider has one of the two ports, or both, but not as this pair.
    virtual void OnTorn(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort, const OPERATION_RULE& decider) = 0;
    // The merge fails: the rule's two lists differ in length.
    virtual void OnUneven(const OPERATION_RULE& rule) = 0;
};

}  // namespace tavo::lib
