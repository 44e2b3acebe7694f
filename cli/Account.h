// The account of a router's own pages while UPnP or NAT-PMP drives the router: storing such settings drops it from
// router.conf. Relies on /etc/portforward/router_account.conf, which only root reads. Promises: one account, that of
// the current gateway; what was typed once is not asked for again.
#pragma once

#include <string>

#include "libtavoportmap.h"

namespace tavo::cli {

// Puts aside what router.conf has for this gateway. False: there is an account, and it could not be kept.
bool KeepAccount(const std::string& szGateway);
// Fills what conf leaves open of an account with what was put aside for this gateway.
void BringAccount(const std::string& szGateway, __tag_TAVO_ROUTER_CONF& conf);
// The settings have it themselves again.
void DropAccount();

}  // namespace tavo::cli
