// A writer of a rule or router file moves the old file aside, to its name and six random letters and digits,
// before it writes the new one. What one that was killed left behind is mended here.
// Relies on nothing. Promises: harmless while a writer is at work; what happened is logged.
#pragma once

namespace tavo {

// Where the file is missing, because a writer was killed in between, the newest copy takes its place
// again. Nothing is ever replaced.
void BringBack(const char* szPath);
// Deletes copies that a newer file made obsolete: brought back at some later day, they would open ports
// that nobody asks for any more. Those of the last ten minutes stay, and so does a name that a person
// could have given ("rule.confbackup").
void DropObsolete(const char* szPath);

}  // namespace tavo
