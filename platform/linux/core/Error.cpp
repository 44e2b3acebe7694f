// The last error of each thread: a number, and the source file and line that set it.
#include "tavo/core.h"

namespace {

struct LastError {
    int nErr = TLIBC_ERR_NONE;
    const char* szFile = "";
    int nLine = 0;
};

thread_local LastError tLastError;

}  // namespace

void TLIBCErrSet(int nErr, const char* szFile, int nLine) {
    tLastError = LastError{nErr, szFile == nullptr ? "" : szFile, nLine};
}

int TLIBCErrGet() {
    return tLastError.nErr;
}

const char* TLIBCErrorGetFile() {
    return tLastError.szFile;
}

int TLIBCErrorGetLine() {
    return tLastError.nLine;
}
