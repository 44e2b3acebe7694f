// Text laid out for the width that it is read at. Relies on nothing but the terminal. Promises: on a terminal no line
// is longer than its width as long as its words are not; a file or a pipe gets each row whole, on a line of its own.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace tavo::cli {

// The columns of what fd leads to: of a terminal COLUMNS or its own word, else 80; 0, without end, for anything else.
size_t WidthOf(int fd);

// How many columns this text takes on a terminal; a text without controls.
size_t CellsOf(std::string_view szText);

// szText with its lines broken between words. A line that begins with blanks goes on beneath its own text: after a
// "- ", or after the two blanks that part a word from what is said of it; one that has neither is a command, unless it
// begins far to the right, and left whole, as a command in quotes is. nWidth 0: as it stands.
std::string Wrap(std::string_view szText, size_t nWidth);

// szText after szHead, wrapped to go on beneath its own beginning; beneath szHead where too few columns are left.
std::string Hang(const std::string& szHead, std::string_view szText, size_t nWidth);

// Rows under one head, as wide as their cells. Where the terminal is too narrow the first column, which names things,
// is cut ("Alderman Home..."), and the last one, which holds the words, is wrapped or put beneath its row.
class Table {
public:
    explicit Table(std::vector<std::string> rgszHead) : mRgRows{std::move(rgszHead)} {}
    // As many cells as the head has. They are cleaned here: what stands in tables comes from routers and files.
    void Add(const std::vector<std::string>& rgszCells);
    // For standard output; empty without rows.
    std::string ToText() const;

private:
    std::vector<std::vector<std::string>> mRgRows;  // the head comes first
};

}  // namespace tavo::cli
