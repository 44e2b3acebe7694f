// Writes the outcome of the user's own compatibility test. Relies on the platform's section files.
// Promises: after a successful Sync() the file holds this record and no other.

#include <unistd.h>

#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "libtavoportmap.h"

namespace {

constexpr char kFile[] = "src/RouterUpnpDBUserWriter.cpp";

using tavo::lib::AtBorder;
using tavo::lib::kUpnpUserDb;
using tavo::lib::Refuse;

}  // namespace

RouterUpnpDBUserWriter::RouterUpnpDBUserWriter(const std::string& section) : mSzSection(section), mPSection(nullptr) {}

RouterUpnpDBUserWriter::~RouterUpnpDBUserWriter() {
    TAVOPFConfFree(mPSection);
}

bool RouterUpnpDBUserWriter::Init() {
    if (mPSection == nullptr) {
        mPSection =
            tavo::lib::NewSection(mSzSection, "%s:%d malloc failed", "%s:%d hash malloc failed", kFile, __LINE__)
                .release();
    }
    return mPSection != nullptr;
}

bool RouterUpnpDBUserWriter::SetSupport(const std::string& support) {
    if (!Init()) {
        return Refuse("%s:%d init failed", kFile, __LINE__);
    }
    return TLIBCSzHashSetValue(mPSection->pHash, "support", support.c_str()) >= 0 ||
           Refuse("%s:%d save config failed", kFile, __LINE__);
}

bool RouterUpnpDBUserWriter::SetMaxRule(int nMaxRule) {
    return AtBorder(false, [&] {
        if (!Init()) {
            return Refuse("%s:%d init failed", kFile, __LINE__);
        }
        return TLIBCSzHashSetValue(mPSection->pHash, "max", std::to_string(nMaxRule).c_str()) >= 0 ||
               Refuse("%s:%d save config failed", kFile, __LINE__);
    });
}

bool RouterUpnpDBUserWriter::Sync() {
    const tavo::lib::OwnerAndMode old(kUpnpUserDb);
    if (TLIBCFileExist(kUpnpUserDb) == 1) {
        unlink(kUpnpUserDb);
    }
    const char* szSection = mPSection == nullptr ? mSzSection.c_str() : mPSection->szSection;
    const int nAdded =
        TLIBCFileAddSection(kUpnpUserDb, szSection, mPSection == nullptr ? nullptr : mPSection->pHash, 0);
    if (nAdded != 1) {
        return Refuse("%s:%d fail set section into [%s] ret=%d[0x%04X %s:%d]", kFile, __LINE__, kUpnpUserDb, nAdded,
                      static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
    }
    old.GiveTo(kUpnpUserDb);
    return true;
}
