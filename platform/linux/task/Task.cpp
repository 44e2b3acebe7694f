// The task manager's records: one JSON file per owner and id below /var/lib/tavo/tasks.
// Relies on jsoncpp and on TextFile's replacement of a file.
// Promises: a record changes whole or not at all; what nobody here can have written (another type, too
// deep, too long) is no record; no name leads out of the directory; nothing is thrown.
#include "tavo/task.h"

#include <json/json.h>

#include <map>
#include <new>
#include <sstream>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "ground/Paths.h"
#include "ground/TextFile.h"

namespace {

constexpr char kTaskDirectory[] = "/var/lib/tavo/tasks";
constexpr char kSuffix[] = ".json";
constexpr mode_t kRecordMode = 0644;  // other processes, of whatever user, read the records
constexpr size_t kMaxName = 200;      // with suffixes still a file name
constexpr size_t kMaxRecord = 1U << 20U;
constexpr int kMaxDepth = 2;  // an object of texts

using tavo::AtBorder;
using tavo::Fail;
using tavo::kStateDir;
using Properties = std::map<std::string, std::string>;

std::string Text(const char* szText) {
    return szText == nullptr ? "" : szText;
}

bool IsName(const std::string& szName) {
    return tavo::IsPathPart(szName) && szName.size() <= kMaxName && tavo::PrintableText(szName, kMaxName) == szName;
}

std::string OwnerDirectory(const std::string& szOwner) {
    return std::string(kTaskDirectory) + "/" + szOwner;
}

// Without a byte 0, which would cut it for every C reader.
bool IsText(const Json::Value& value) {
    return value.isString() && value.asString().find('\0') == std::string::npos;
}

std::optional<Properties> ParseRecord(const std::string& szText) {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["stackLimit"] = kMaxDepth;  // deeper nesting throws
    const std::unique_ptr<Json::CharReader> pReader(builder.newCharReader());
    Json::Value root;
    if (!pReader->parse(szText.data(), szText.data() + szText.size(), &root, nullptr) || !root.isObject()) {
        return std::nullopt;
    }
    Properties properties;
    for (auto it = root.begin(); it != root.end(); ++it) {
        if (!IsText(*it)) {
            return std::nullopt;
        }
        properties.emplace(it.name(), it->asString());
    }
    return properties;
}

std::string FormatRecord(const Properties& properties) {
    Json::Value root(Json::objectValue);
    for (const auto& [szName, szValue] : properties) {
        root[szName] = szValue;
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    builder["emitUTF8"] = true;  // a router's text comes back byte for byte, also when it is no UTF-8
    std::ostringstream text;
    text.exceptions(std::ios::badbit);  // a stream keeps silent about memory that ran out, and half a record is none
    std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter())->write(root, &text);
    text << '\n';
    return text.str();
}

std::optional<Properties> ReadRecord(const std::string& szPath) {
    const std::optional<std::string> szText = tavo::ReadFile(szPath);
    return szText && szText->size() <= kMaxRecord ? ParseRecord(*szText) : std::nullopt;
}

}  // namespace

namespace NOS {

struct Task::Impl {
    std::string szOwner;
    std::string szPath;  // empty: the names are none
    Properties properties;
    bool blUpdating = false;

    Impl(const std::string& szOwnerName, const std::string& szId) : szOwner(szOwnerName) {
        if (IsName(szOwner) && IsName(szId)) {
            szPath = OwnerDirectory(szOwner) + "/" + szId + kSuffix;
        }
    }

    int Write() const {
        const std::string szText = FormatRecord(properties);
        if (szPath.empty() || szText.size() > kMaxRecord) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, 0);
        }
        for (const std::string& szDirectory :
             {std::string(kStateDir), std::string(kTaskDirectory), OwnerDirectory(szOwner)}) {
            tavo::MakeDirectory(szDirectory);
        }
        return tavo::WriteFileAtomic(szPath, szText, kRecordMode) ? 1 : 0;
    }
};

Task::Task(const char* szOwner, const char* szId)
    : mPImpl(AtBorder(std::unique_ptr<Impl>(), [&] { return std::make_unique<Impl>(Text(szOwner), Text(szId)); })) {}

Task::~Task() = default;

int Task::reload() {
    if (mPImpl == nullptr) {
        return 0;
    }
    mPImpl->properties.clear();
    return AtBorder(0, [&] {
        std::optional<Properties> read = mPImpl->szPath.empty() ? std::nullopt : ReadRecord(mPImpl->szPath);
        if (!read) {
            return Fail(TLIBC_ERR_NOT_FOUND, 0);
        }
        mPImpl->properties = std::move(*read);
        return 1;
    });
}

int Task::remove() {
    if (mPImpl != nullptr) {
        mPImpl->properties.clear();
    }
    return 1;
}

int Task::beginUpdate() {
    if (mPImpl == nullptr || mPImpl->blUpdating) {
        return Fail(TLIBC_ERR_BAD_PARAMETER, 0);
    }
    mPImpl->blUpdating = true;
    return 1;
}

int Task::setProperty(const char* szName, const char* szValue) {
    return AtBorder(0, [&] {
        if (mPImpl == nullptr || Text(szName).empty() || szValue == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, 0);
        }
        mPImpl->properties[szName] = szValue;
        return 1;
    });
}

int Task::endUpdate() {
    if (mPImpl == nullptr || !mPImpl->blUpdating) {
        return Fail(TLIBC_ERR_BAD_PARAMETER, 0);
    }
    mPImpl->blUpdating = false;
    return AtBorder(0, [&] { return mPImpl->Write(); });
}

std::string Task::getStringProperty(const char* szName, const char* szDefault) const {
    return AtBorder(std::string(), [&] {
        if (mPImpl == nullptr || szName == nullptr) {
            return Text(szDefault);
        }
        const auto it = mPImpl->properties.find(szName);
        return it == mPImpl->properties.end() ? Text(szDefault) : it->second;
    });
}

struct TaskMgr::Impl {
    std::string szOwner;
};

TaskMgr::TaskMgr(const char* szOwner)
    : mPImpl(AtBorder(std::unique_ptr<Impl>(), [&] { return std::make_unique<Impl>(Impl{Text(szOwner)}); })) {}

TaskMgr::~TaskMgr() = default;

Task* TaskMgr::getTask(const char* szId) {
    std::unique_ptr<Task> pTask(mPImpl == nullptr ? nullptr : new (std::nothrow) Task(mPImpl->szOwner.c_str(), szId));
    return pTask != nullptr && pTask->reload() == 1 ? pTask.release() : nullptr;
}

Task* TaskMgr::createTask(const char* szId) {
    std::unique_ptr<Task> pTask(mPImpl == nullptr ? nullptr : new (std::nothrow) Task(mPImpl->szOwner.c_str(), szId));
    const bool blWritten = pTask != nullptr && pTask->beginUpdate() == 1 && pTask->endUpdate() == 1;
    return blWritten ? pTask.release() : nullptr;
}

}  // namespace NOS
