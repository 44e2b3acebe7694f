// Puts on record what a router is about to be asked for. Relies on what the pass knows and on whoever saves the record.
// Promises: a crash between the asking and the answer leaves nothing that nobody knows of; where the record cannot be
// saved it says what it said before, and the place is marked as one that nothing may be asked for.
#pragma once

#include "mapping/Places.h"

namespace tavo {

// Of those of the places where something is to be asked for: one saving for all.
void NoteIntents(Places& places, const PlaceList& rgpPlaces);
void NoteIntent(Places& places, Place& place);

}  // namespace tavo
