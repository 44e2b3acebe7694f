// Runs the tool that applies the rules on a manual router. Relies on the platform's shell command.
// Promises: returns when the tool has returned; only a shell that cannot be started is a failure.
#include <cstdio>

#include "Log.h"
#include "Paths.h"
#include "libtavoportmap.h"
#include "tavo/core.h"

namespace {

constexpr char kFile[] = "src/PortForwardScript.cpp";

}  // namespace

bool PortForwardScript::Run() {
    char szCommand[tavo::lib::kCommandSize] = {};
    const int nLength = std::snprintf(szCommand, sizeof(szCommand), "%s%s >/dev/null 2>&1", tavo::lib::kBinDir,
                                      tavo::lib::kForwardTool);
    if (nLength < 0 || TLIBCSystem(szCommand) == -1) {
        return tavo::lib::Refuse("%s:%d execute %s failed", kFile, __LINE__, tavo::lib::kForwardTool);
    }
    return true;
}

bool PortForwardScript::IsAlive() {
    return TLIBCIsProcAlive(tavo::lib::kForwardTool) == 1;
}
