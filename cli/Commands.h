// The commands of the tool. Relies on CLI11 for their arguments. Promises: each function offers one
// family of commands; parsing only notes what is to be done, nothing is done before it has succeeded.
#pragma once

#include <CLI/CLI.hpp>
#include <functional>

#include "Answer.h"

namespace tavo::cli {

struct Request {
    bool blJson = false;
    std::function<Reply()> fnCommand;  // what the arguments ask for
};

void OfferOpen(CLI::App& app, Request& request);
void OfferClose(CLI::App& app, Request& request);
void OfferRules(CLI::App& app, Request& request);
void OfferSave(CLI::App& app, Request& request);
void OfferStatus(CLI::App& app, Request& request);
void OfferDetect(CLI::App& app, Request& request);
void OfferRouter(CLI::App& app, Request& request);
void OfferRouters(CLI::App& app, Request& request);
void OfferCompat(CLI::App& app, Request& request);
void OfferTest(CLI::App& app, Request& request);
void OfferReport(CLI::App& app, Request& request);
void OfferService(CLI::App& app, Request& request);
void OfferDiag(CLI::App& app, Request& request);

// A new command below app that takes the options of the commands above it, too.
CLI::App* AddCommand(CLI::App& app, const std::string& szName, const std::string& szWhat);

}  // namespace tavo::cli
