// Shell completions made from the tool's own commands. Relies on CLI11's tree of commands.
// Promises: a script for each shell that knows every command and option there is, hidden ones aside.
#pragma once

#include "Commands.h"

namespace tavo::cli {

// Adds the hidden command "completions SHELL", which prints the script.
void OfferCompletions(CLI::App& app, Request& request);

}  // namespace tavo::cli
