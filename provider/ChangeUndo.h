#pragma once

#include <functional>

#include "platform/Url.h"

namespace tamber {

// Reverses a change an item operation made on disk, for when the operation cannot hand back
// the item it made or moved (its record could not be read): an operation that reports an
// error must have changed nothing. `done` runs once the attempt is over; a failed attempt is
// logged, since there is nothing better to do with it.
using ChangeUndo = std::function<void(const Url& changed, std::function<void()> done)>;

// Moves the item back to where it was, under its old name.
ChangeUndo moveBackTo(const Url& original);
// Deletes the item the operation made.
ChangeUndo removeMade();

}  // namespace tamber
