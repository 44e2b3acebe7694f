// What the writer of key files tells the record of the run keys (tavo/runkeys.h). Relies on that record.
// Promises: costs nothing where no operation is noted.
#pragma once

#include <string_view>

namespace tavo {

// Notes a new file that is about to take the place of szPath as the noted operation's own, where this process, or
// the one that forked it, is at one. False: it is, and the note cannot be made: the file must not take its place.
bool NoteWrite(std::string_view szPath, int fdNew);

}  // namespace tavo
