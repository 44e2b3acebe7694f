// Files of ours in directories where anybody may put something: /tmp and its like. Relies on rename, which takes
// whatever stands there out of the way. Promises: see MakeOwnFile.
#pragma once

namespace tavo {

// Sees to it that szPath is a plain file that belongs to this process's user alone: it stays when it is, else an empty
// one takes its place at once, also where somebody holds a lock on what stood there, and that is deleted, or stays
// beside it under another name. False with errno set.
bool MakeOwnFile(const char* szPath);

}  // namespace tavo
