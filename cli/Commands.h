// The commands of the tool. Relies on CLI11 for their arguments. Promises: each function offers one
// family of commands; parsing only notes what is to be done, nothing is done before it has succeeded.
#pragma once

#include <CLI/CLI.hpp>
#include <functional>

#include "Answer.h"

namespace tavo::cli {

struct Session {
    bool blJson = false;
    std::function<Reply()> fnCommand;  // what the arguments ask for
};

void OfferRules(CLI::App& app, Session& session);
void OfferSave(CLI::App& app, Session& session);
void OfferStatus(CLI::App& app, Session& session);
void OfferDetect(CLI::App& app, Session& session);
void OfferRouter(CLI::App& app, Session& session);
void OfferRouters(CLI::App& app, Session& session);

// A new command below app that takes the options of the commands above it, too.
CLI::App* AddCommand(CLI::App& app, const std::string& szName, const std::string& szWhat);

}  // namespace tavo::cli
