// Shows answers. Relies on fmt and jsoncpp, which writes every character beyond ASCII as an escape.
// Promises: see Answer.h.
#include "Answer.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "Table.h"

namespace tavo::cli {

namespace {

struct Character {
    uint32_t nCode = 0;
    size_t nBytes = 0;  // 0: the text is not UTF-8 here
};

Character FirstCharacter(std::string_view szText) {
    constexpr uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    const auto nLead = static_cast<unsigned char>(szText[0]);
    if (nLead < 0x80) {
        return {nLead, 1};
    }
    const size_t nBytes = nLead >= 0xf0 ? 4 : nLead >= 0xe0 ? 3 : 2;
    if (nLead < 0xc2 || nLead > 0xf4 || szText.size() < nBytes) {
        return {};
    }
    uint32_t nCode = nLead & (0xffU >> (nBytes + 1));
    for (size_t i = 1; i < nBytes; ++i) {
        const auto nByte = static_cast<unsigned char>(szText[i]);
        if ((nByte & 0xc0) != 0x80) {
            return {};
        }
        nCode = (nCode << 6) | (nByte & 0x3fU);
    }
    const bool blSurrogate = nCode >= 0xd800 && nCode <= 0xdfff;
    return nCode < kSmallest[nBytes] || nCode > 0x10ffff || blSurrogate ? Character{} : Character{nCode, nBytes};
}

// Controls of both ranges, line separators, and the marks that turn the direction of a line around.
bool IsHarmful(uint32_t nCode) {
    return nCode < 0x20 || (nCode >= 0x7f && nCode < 0xa0) || (nCode >= 0x200b && nCode <= 0x200f) ||
           (nCode >= 0x2028 && nCode <= 0x202e) || (nCode >= 0x2060 && nCode <= 0x2069) || nCode == 0x061c ||
           nCode == 0xfeff;
}

std::string Complaint(const std::string& szWord, Ink enInk, const std::string& szText) {
    // The word is painted after the lines are broken, for which it must have its own width.
    const std::string szLines = Wrap(szWord + ": " + szText, WidthOf(STDERR_FILENO));
    return Paint(enInk, szWord, STDERR_FILENO) + szLines.substr(szWord.size()) + "\n";
}

bool Write(FILE* pStream, const std::string& szText) {
    return (szText.empty() || std::fwrite(szText.data(), szText.size(), 1, pStream) == 1) && std::fflush(pStream) == 0;
}

Json::Value ToJson(const Reply& reply) {
    Json::Value js = reply.jsAnswer;
    js["ok"] = reply.enExit == kOk;
    js["message"] = reply.szMessage;
    js["warnings"] = Json::arrayValue;
    for (const std::string& szWarning : reply.rgszWarnings) {
        js["warnings"].append(szWarning);
    }
    return js;
}

}  // namespace

int Print(const Reply& reply, bool blJson) {
    if (blJson) {
        return Write(stdout, ToJson(reply).toStyledString()) ? reply.enExit : kFailed;
    }
    const bool blWell = reply.enExit == kOk;
    std::string szOut = reply.szBody;
    if (blWell && !reply.szMessage.empty()) {
        szOut += Wrap(reply.szMessage, WidthOf(STDOUT_FILENO)) + "\n";
    }
    const bool blWritten = Write(stdout, szOut);
    std::string szComplaints;
    for (const std::string& szWarning : reply.rgszWarnings) {
        szComplaints += Complaint("warning", Ink::kYellow, szWarning);
    }
    if (!blWell && !reply.szMessage.empty()) {
        szComplaints += Complaint("error", Ink::kRed, reply.szMessage);
    }
    Write(stderr, szComplaints);
    return blWritten ? reply.enExit : kFailed;
}

void Tell(const std::string& szText) {
    Write(stderr, szText);
}

std::string Clean(std::string_view szText) {
    std::string szClean;
    while (!szText.empty()) {
        const Character character = FirstCharacter(szText);
        const size_t nBytes = std::max<size_t>(character.nBytes, 1);
        if (character.nBytes == 0 || (nBytes == 1 && IsHarmful(character.nCode))) {
            szClean += fmt::format("\\x{:02x}", static_cast<unsigned char>(szText[0]));
        } else if (IsHarmful(character.nCode)) {
            szClean += fmt::format("\\u{{{:x}}}", character.nCode);
        } else {
            szClean += szText.substr(0, nBytes);
        }
        szText.remove_prefix(nBytes);
    }
    return szClean;
}

bool IsSmartTerminal(int fd) {
    const char* szTerm = std::getenv("TERM");
    return isatty(fd) != 0 && szTerm != nullptr && std::string_view(szTerm) != "dumb";
}

std::string Paint(Ink enInk, const std::string& szText, int fd) {
    const char* szNoColour = std::getenv("NO_COLOR");
    if (!IsSmartTerminal(fd) || (szNoColour != nullptr && *szNoColour != '\0')) {
        return szText;
    }
    const int nCode = enInk == Ink::kBold ? 1 : enInk == Ink::kRed ? 31 : 33;
    return fmt::format("\x1b[{}m{}\x1b[0m", nCode, szText);
}

std::string Columns(const std::vector<std::pair<std::string, std::string>>& rgLines) {
    size_t nLabel = 0;
    for (const auto& [szLabel, szValue] : rgLines) {
        nLabel = std::max(nLabel, CellsOf(szLabel));
    }
    std::string szText;
    const size_t nWidth = WidthOf(STDOUT_FILENO);
    for (const auto& [szLabel, szValue] : rgLines) {
        szText += szValue.empty() ? "" : Hang(fmt::format("{:<{}}  ", szLabel, nLabel), szValue, nWidth) + "\n";
    }
    return szText;
}

}  // namespace tavo::cli
