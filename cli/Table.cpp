// Lays text out. Relies on the C library's knowledge of how wide a character is. Promises: see Table.h.
#include "Table.h"

#include <locale.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <wchar.h>

#include <algorithm>
#include <charconv>
#include <cstdlib>
#include <iterator>
#include <numeric>

#include "Answer.h"

namespace tavo::cli {

namespace {

constexpr size_t kUsualWidth = 80;
constexpr size_t kLeastWidth = 20;  // what calls itself narrower is not believed
constexpr size_t kReadable = 22;    // columns that running text needs beside something else
constexpr size_t kLeastFirst = 8;   // what is left of a first column at least
constexpr size_t kFirstShare = 4;   // a part of the width that a name may have beside words: one in so many
constexpr size_t kMoreIndent = 4;   // of text that has to stand beneath its line
constexpr size_t kDeep = 12;        // blanks before a line that goes on with what is said beside the lines above
constexpr std::string_view kGap = "  ";
constexpr std::string_view kCut = "...";

// Characters beyond ASCII have a width only in a locale that knows them; which one the user has does not matter here.
locale_t Unicode() {
    static const locale_t locale = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
    return locale;
}

// Bytes and columns of the first character of a text that is not empty.
std::pair<size_t, size_t> FirstCell(std::string_view szText) {
    wchar_t cWide = 0;
    mbstate_t state = {};
    const size_t nBytes = mbrtowc(&cWide, szText.data(), szText.size(), &state);
    if (nBytes == 0 || nBytes > szText.size()) {
        return {1, 1};
    }
    return {nBytes, static_cast<size_t>(std::max(0, wcwidth(cWide)))};
}

// How many bytes fit into nCells columns.
size_t Fitting(std::string_view szText, size_t nCells, size_t* pnUsed = nullptr) {
    const locale_t before = Unicode() == nullptr ? nullptr : uselocale(Unicode());
    size_t nAt = 0, nUsed = 0;
    while (nAt < szText.size()) {
        const auto [nBytes, nWide] = FirstCell(szText.substr(nAt));
        if (nUsed + nWide > nCells) {
            break;
        }
        nAt += nBytes;
        nUsed += nWide;
    }
    if (before != nullptr) {
        uselocale(before);
    }
    if (pnUsed != nullptr) {
        *pnUsed = nUsed;
    }
    return nAt;
}

std::string Pad(const std::string& szText, size_t nWidth) {
    const size_t nCells = CellsOf(szText);
    return szText + std::string(nWidth > nCells ? nWidth - nCells : 0, ' ');
}

std::string Cut(const std::string& szText, size_t nWidth) {
    return CellsOf(szText) <= nWidth ? szText
                                     : szText.substr(0, Fitting(szText, nWidth - kCut.size())) + std::string(kCut);
}

// The end of the word that begins at nAt; a command in quotes is one word as long as it fits.
size_t EndOfWord(std::string_view szLine, size_t nAt, size_t nWidth) {
    if (szLine[nAt] == '\'') {
        const size_t nQuote = szLine.find('\'', nAt + 1);
        if (nQuote != std::string_view::npos && CellsOf(szLine.substr(nAt, nQuote - nAt)) < nWidth) {
            nAt = nQuote;
        }
    }
    return std::min(szLine.find(' ', nAt), szLine.size());
}

// The words of szLine after nUsed columns that are taken already; lines after the first begin with nIndent blanks.
std::string Flow(std::string_view szLine, size_t nWidth, size_t nUsed, size_t nIndent) {
    std::string szText;
    bool blFirst = true;  // of its line
    for (size_t nAt = szLine.find_first_not_of(' '); nAt < szLine.size(); nAt = szLine.find_first_not_of(' ', nAt)) {
        const size_t nEnd = EndOfWord(szLine, nAt, nWidth - nIndent);
        const std::string_view szWord = szLine.substr(nAt, nEnd - nAt);
        const size_t nCells = CellsOf(szWord);
        if (!blFirst && nUsed + 1 + nCells > nWidth) {
            szText += "\n" + std::string(nIndent, ' ');
            nUsed = nIndent;
            blFirst = true;
        }
        szText += blFirst ? "" : " ";
        szText += szWord;
        nUsed += nCells + (blFirst ? 0 : 1);
        blFirst = false;
        nAt = nEnd;
    }
    return szText;
}

// One line of a text to be wrapped.
std::string WrapLine(std::string_view szLine, size_t nWidth) {
    const size_t nBegin = szLine.find_first_not_of(' ');
    if (nBegin == std::string_view::npos || CellsOf(szLine) <= nWidth) {
        return std::string(szLine);
    }
    if (nBegin == 0) {
        return Flow(szLine, nWidth, 0, 0);
    }
    if (szLine.substr(nBegin).starts_with("- ")) {
        return std::string(nBegin, ' ') + Flow(szLine, nWidth, nBegin, nBegin + 2);
    }
    if (nBegin >= kDeep) {
        const size_t nIndent = nBegin + kReadable <= nWidth ? nBegin : 2 * kMoreIndent;
        return std::string(nIndent, ' ') + Flow(szLine, nWidth, nIndent, nIndent);
    }
    const size_t nGap = szLine.find(kGap, nBegin);
    const size_t nTail = nGap == std::string_view::npos ? nGap : szLine.find_first_not_of(' ', nGap);
    if (nTail == std::string_view::npos) {
        return std::string(szLine);
    }
    return Hang(std::string(szLine.substr(0, nTail)), szLine.substr(nTail), nWidth);
}

// How the rows of a table share the columns that there are.
struct Shape {
    std::vector<size_t> rgWidths;
    size_t nWidth = 0;       // of the terminal; 0: no end
    bool blStacked = false;  // not even the short columns fit beside each other
};

Shape ShapeOf(const std::vector<std::vector<std::string>>& rgRows, size_t nWidth) {
    Shape shape{std::vector<size_t>(rgRows.front().size()), nWidth};
    for (const auto& rgszCells : rgRows) {
        for (size_t i = 0; i < rgszCells.size(); ++i) {
            shape.rgWidths[i] = std::max(shape.rgWidths[i], CellsOf(rgszCells[i]));
        }
    }
    const size_t nLast = shape.rgWidths.back();
    const size_t nShort =
        std::accumulate(shape.rgWidths.begin(), shape.rgWidths.end() - 1, kGap.size() * (shape.rgWidths.size() - 1));
    if (nWidth == 0 || nShort + std::min(nLast, kReadable) <= nWidth) {
        return shape;
    }
    // A long name gives way to the words beside it; where that does not suffice, to the other columns.
    size_t& nFirst = shape.rgWidths.front();
    const size_t nRest = nShort - nFirst;
    const size_t nBeside = nRest + kReadable < nWidth ? nWidth - nRest - kReadable : 0;
    const size_t nRoom = nRest < nWidth ? nWidth - nRest : 0;
    shape.blStacked = nRoom < std::min(nFirst, kLeastFirst);
    nFirst = nBeside >= nWidth / kFirstShare ? nBeside : std::min(nFirst, nRoom);
    return shape;
}

// A row that has no room: its first cell, and beneath it the others.
std::string StackedRow(const std::vector<std::string>& rgszCells, size_t nWidth) {
    std::string szOthers;
    for (size_t i = 1; i < rgszCells.size(); ++i) {
        szOthers += (szOthers.empty() || rgszCells[i].empty() ? "" : ", ") + rgszCells[i];
    }
    return Cut(rgszCells.front(), nWidth) + "\n" + std::string(kMoreIndent, ' ') +
           Flow(szOthers, nWidth, kMoreIndent, kMoreIndent);
}

// The cells of a row, the last one beside or beneath the others.
std::string Row(const std::vector<std::string>& rgszCells, const Shape& shape) {
    if (shape.blStacked) {
        return StackedRow(rgszCells, shape.nWidth);
    }
    std::string szRow;
    for (size_t i = 0; i + 1 < rgszCells.size(); ++i) {
        szRow += Pad(Cut(rgszCells[i], shape.rgWidths[i]), shape.rgWidths[i]) + std::string(kGap);
    }
    szRow = Hang(szRow, rgszCells.back(), shape.nWidth);
    szRow.erase(szRow.find_last_not_of(' ') + 1);
    return szRow;
}

}  // namespace

size_t WidthOf(int fd) {
    if (isatty(fd) == 0) {
        return 0;
    }
    size_t nWidth = 0;
    if (const char* szColumns = std::getenv("COLUMNS"); szColumns != nullptr) {
        std::from_chars(szColumns, szColumns + std::string_view(szColumns).size(), nWidth);
    }
    winsize size = {};
    if (nWidth == 0 && ioctl(fd, TIOCGWINSZ, &size) == 0) {
        nWidth = size.ws_col;
    }
    return nWidth == 0 ? kUsualWidth : std::max(nWidth, kLeastWidth);
}

size_t CellsOf(std::string_view szText) {
    size_t nCells = 0;
    Fitting(szText, std::string_view::npos, &nCells);
    return nCells;
}

std::string Wrap(std::string_view szText, size_t nWidth) {
    if (nWidth == 0) {
        return std::string(szText);
    }
    std::string szWrapped;
    for (size_t nAt = 0; nAt < szText.size();) {
        const size_t nEnd = std::min(szText.find('\n', nAt), szText.size());
        szWrapped += WrapLine(szText.substr(nAt, nEnd - nAt), nWidth);
        szWrapped += nEnd < szText.size() ? "\n" : "";
        nAt = nEnd + 1;
    }
    return szWrapped;
}

std::string Hang(const std::string& szHead, std::string_view szText, size_t nWidth) {
    const size_t nUsed = CellsOf(szHead);
    if (nWidth == 0 || nUsed + CellsOf(szText) <= nWidth) {
        return szHead + std::string(szText);
    }
    if (nUsed + kReadable <= nWidth) {
        return szHead + Flow(szText, nWidth, nUsed, nUsed);
    }
    const size_t nIndent = szHead.find_first_not_of(' ') + kMoreIndent;
    return szHead.substr(0, szHead.find_last_not_of(' ') + 1) + "\n" + std::string(nIndent, ' ') +
           Flow(szText, nWidth, nIndent, nIndent);
}

void Table::Add(const std::vector<std::string>& rgszCells) {
    std::vector<std::string>& rgszRow = mRgRows.emplace_back();
    std::transform(rgszCells.begin(), rgszCells.end(), std::back_inserter(rgszRow), &Clean);
}

std::string Table::ToText() const {
    const size_t nWidth = WidthOf(STDOUT_FILENO);
    if (mRgRows.size() < 2) {
        return "";
    }
    const Shape shape = ShapeOf(mRgRows, nWidth);
    std::string szText;
    for (const auto& rgszCells : mRgRows) {
        const std::string szRow = Row(rgszCells, shape);
        szText += (&rgszCells == &mRgRows.front() ? Paint(Ink::kBold, szRow, STDOUT_FILENO) : szRow) + "\n";
    }
    return szText;
}

}  // namespace tavo::cli
