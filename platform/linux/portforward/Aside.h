// A writer of a rule or router file moves the old file aside, to its name and a suffix (see Suffix.h), before it
// writes the new one. What a writer that was killed left behind is mended here; a copy that a person could have named
// is nobody's business, but for router.conf.bak, which a writer of ours makes under that name.
// Relies on nothing. Promises: harmless while a writer is at work; what happened is logged.
#pragma once

namespace tavo {

// Where the file is missing, because a writer was killed in between, the newest copy takes its place again. Nothing is
// replaced, but for what a report that was killed put in the place of the settings: they come back from the name and
// a suffix that begins with a digit, unless somebody has changed router.conf since. False: there is a copy, and it is
// left to its owner, who lives.
bool BringBack(const char* szPath);
// Only what a killed report set aside, and only of router.conf; any other path is left alone. For whoever is about to
// write as well: he must not take what a killed writer left for the live file.
void EndReport(const char* szPath);
// Deletes copies that a newer file made obsolete: brought back at some later day, they would open ports that nobody
// asks for any more, and they may hold a password. Those of the last ten minutes stay, those of a writer that lives,
// and router.conf.bak.
void DropObsolete(const char* szPath);

}  // namespace tavo
