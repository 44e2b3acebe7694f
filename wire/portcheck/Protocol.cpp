// Reads and writes the messages. Relies on jsoncpp in its strict mode. Promises: see Protocol.h.
#include "wire/portcheck/Protocol.h"

#include <memory>

namespace tavo {

namespace {

constexpr int kMaxDepth = 8;

}  // namespace

std::optional<Json::Value> ParseMessage(const std::string& szText) {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["stackLimit"] = kMaxDepth;
    const std::unique_ptr<Json::CharReader> pReader(builder.newCharReader());
    Json::Value jsMessage;
    try {
        if (pReader->parse(szText.data(), szText.data() + szText.size(), &jsMessage, nullptr) && jsMessage.isObject()) {
            return jsMessage;
        }
    } catch (const Json::Exception&) {  // nested too deeply
    }
    return std::nullopt;
}

std::string FormatMessage(const Json::Value& jsMessage) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, jsMessage);
}

}  // namespace tavo
