// "router": the stored settings of the router behind the current gateway. Relies on TLibGetRouterConf and
// TLibSetRouterConf. Promises: the password is shown only when that is asked for and never taken from the
// command line; settings that could not be read are neither shown as empty nor overwritten.
#include <fmt/format.h>

#include "Account.h"
#include "Box.h"
#include "Commands.h"
#include "RouterTable.h"
#include "Secret.h"
#include "Settings.h"
#include "Usage.h"
#include "Verdict.h"

namespace tavo::cli {

namespace {

// ---- show -----------------------------------------------------------------------------------------------

Json::Value ToJson(const RouterConf& conf, bool blShowPassword) {
    Json::Value js;
    js["brand"] = conf.szBrand;
    js["model"] = conf.szModel;
    js["version"] = conf.szVersion;
    js["upnp"] = conf.szSupportUpnp;
    js["natpmp"] = conf.szSupportNatpmp;
    js["user"] = conf.szUser;
    js["password_set"] = *conf.szPass != '\0';
    if (blShowPassword) {
        js["password"] = conf.szPass;
    }
    js["conn_type"] = conf.szConnType;
    js["conn_port"] = conf.szConnPort;
    js["max_rules"] = *conf.szMaxRule == '\0' ? Json::Value() : Json::Value(std::atoi(conf.szMaxRule));
    return js;
}

std::string ToText(const std::string& szGateway, const RouterConf& conf, bool blShowPassword) {
    const Way enWay = WayOf(conf.szSupportUpnp, conf.szSupportNatpmp);
    const bool blDaemon = enWay == Way::kUpnp || enWay == Way::kNatpmp;
    const std::string szHidden = *conf.szPass == '\0' ? "" : "set, not shown (--show-password shows it)";
    return Columns({
        {"gateway", szGateway},
        {"driven by", ToWords(blDaemon ? enWay : Way::kManual)},
        {"brand", Clean(conf.szBrand)},
        {"model", Clean(conf.szModel)},
        {"version", Clean(conf.szVersion)},
        {"UPnP", Clean(conf.szSupportUpnp)},
        {"NAT-PMP", Clean(conf.szSupportNatpmp)},
        {"holds", blDaemon ? CapacityWords(*conf.szMaxRule == '\0' ? -1 : std::atoi(conf.szMaxRule)) : ""},
        {"user", Clean(conf.szUser)},
        {"password", blShowPassword ? Clean(conf.szPass) : szHidden},
        {"connection", Clean(conf.szConnType) + (*conf.szConnPort == '\0' ? "" : ", port " + Clean(conf.szConnPort))},
    });
}

Reply Show(bool blShowPassword) {
    const Settings settings = ReadSettings();
    if (settings.obstacle) {
        return *settings.obstacle;
    }
    Reply reply;
    reply.jsAnswer["gateway"] = settings.szGateway;
    reply.jsAnswer["router"] = Json::Value();
    if (settings.enFound == Found::kNothing) {
        const std::string szOther = OtherGateway(settings.szGateway);
        reply.jsAnswer["other_gateway"] = szOther.empty() ? Json::Value() : Json::Value(szOther);
        reply.szMessage =
            fmt::format("nothing is stored for the router {} yet{}; 'sudo tavoportmap setup' finds out what it is",
                        settings.szGateway, szOther.empty() ? "" : ", only for another one (" + Clean(szOther) + ")");
        return reply;
    }
    if (settings.enFound == Found::kWithoutLimit) {
        reply.rgszWarnings.emplace_back(
            "nobody has recorded how many rules this router holds, so no rules can be saved; 'sudo tavoportmap router "
            "set --max-rules 0' records that no limit is known, another number how many there are");
    }
    reply.jsAnswer["router"] = ToJson(settings.conf, blShowPassword);
    reply.szBody = ToText(settings.szGateway, settings.conf, blShowPassword);
    return reply;
}

// ---- set ------------------------------------------------------------------------------------------------

struct Wish {
    std::optional<std::string> szBrand, szModel, szVersion, szUpnp, szNatpmp, szUser, szConnType, szConnPort;
    std::string szPasswordFile;
    bool blAskPassword = false;
    int nMaxRules = -1;

    bool IsEmpty() const {
        return !szBrand && !szModel && !szVersion && !szUpnp && !szNatpmp && !szUser && !szConnType && !szConnPort &&
               szPasswordFile.empty() && !blAskPassword && nMaxRules < 0;
    }
};

template <size_t kSize>
bool Overlay(char (&szField)[kSize], const std::optional<std::string>& szWish) {
    return !szWish || Put(szField, *szWish);
}

// The password that goes with the wish; nothing when none was asked for or a new user has none yet.
Reply ReadPassword(const Wish& wish, RouterConf& conf) {
    std::optional<std::string> szPassword;
    if (!wish.szPasswordFile.empty()) {
        szPassword = ReadSecret(wish.szPasswordFile);
    } else if (wish.blAskPassword || !wish.szUser.value_or("").empty()) {
        szPassword = AskSecret("password of the router's account: ");
    } else {
        return {};
    }
    if (!szPassword) {
        return {
            .enExit = kUsage,
            .szMessage = wish.szPasswordFile.empty()
                             ? "there is no terminal to ask for the password at; give it with --password-file FILE, "
                               "or on standard input with --password-file -"
                             : fmt::format("no password could be read from '{}'", Clean(wish.szPasswordFile))};
    }
    return Put(conf.szPass, *szPassword) ? Reply{} : Reply{.enExit = kUsage, .szMessage = "the password is too long"};
}

bool IsDaemonRouter(const RouterConf& conf) {
    const Way enWay = WayOf(conf.szSupportUpnp, conf.szSupportNatpmp);
    return enWay == Way::kUpnp || enWay == Way::kNatpmp;
}

// What the wish leaves open; empty when nothing.
std::string FaultOf(const RouterConf& conf) {
    if (*conf.szBrand == '\0' && *conf.szModel == '\0' && *conf.szVersion == '\0') {
        return "what is the router? Say at least one of --brand, --model and --version, under which it is remembered";
    }
    const bool blReachable = *conf.szConnType != '\0' && *conf.szConnPort != '\0';
    return IsDaemonRouter(conf) || blReachable
               ? ""
               : "a router without UPnP and NAT-PMP is driven through its own pages, which needs --conn-type and "
                 "--conn-port (for example --conn-type http --conn-port 80); if it has one of the two, say --upnp "
                 "yes or --natpmp yes";
}

Reply Set(const Wish& wish) {
    if (wish.IsEmpty()) {
        return {.enExit = kUsage,
                .szMessage =
                    "nothing to set; for example\n"
                    "  sudo tavoportmap router set --brand Acme --model R1 --upnp yes --max-rules 32\n"
                    "  sudo tavoportmap router set --user admin --conn-type http --conn-port 80\n"
                    "'tavoportmap router set --help' explains"};
    }
    Settings settings = ReadSettings();
    if (settings.obstacle) {
        return *settings.obstacle;
    }
    RouterConf& conf = settings.conf;
    if (settings.enFound == Found::kNothing) {
        Put(conf.szSupportUpnp, "no");
        Put(conf.szSupportNatpmp, "no");
    }
    if (!Overlay(conf.szBrand, wish.szBrand) || !Overlay(conf.szModel, wish.szModel) ||
        !Overlay(conf.szVersion, wish.szVersion) || !Overlay(conf.szSupportUpnp, wish.szUpnp) ||
        !Overlay(conf.szSupportNatpmp, wish.szNatpmp) || !Overlay(conf.szUser, wish.szUser) ||
        !Overlay(conf.szConnType, wish.szConnType) || !Overlay(conf.szConnPort, wish.szConnPort)) {
        return {.enExit = kUsage, .szMessage = fmt::format("a value is too long; {} bytes fit", TAVO_TEXT_SIZE - 1)};
    }
    if (!IsDaemonRouter(conf)) {
        BringAccount(settings.szGateway, conf);
    }
    if (const std::string szFault = FaultOf(conf); !szFault.empty()) {
        return {.enExit = kUsage, .szMessage = szFault};
    }
    if (const Reply reply = ReadPassword(wish, conf); reply.enExit != kOk) {
        return reply;
    }
    return StoreSettings(settings.szGateway, conf, wish.nMaxRules);
}

void OfferSet(CLI::App& router, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pSet = AddCommand(router, "set", "change what is stored; what is not named stays as it is");
    const auto fnText = [pSet](const char* szName, std::optional<std::string>& szValue, const char* szWhat) {
        return pSet->add_option(szName, szValue, szWhat)->type_name("TEXT");
    };
    fnText("--brand", pWish->szBrand, "who made it");
    fnText("--model", pWish->szModel, "its model, as 'tavoportmap routers' spells it");
    fnText("--version", pWish->szVersion, "its version");
    for (auto [szName, pValue] : {std::pair{"--upnp", &pWish->szUpnp}, std::pair{"--natpmp", &pWish->szNatpmp}}) {
        fnText(szName, *pValue, "whether it is driven by this protocol: yes, no or unknown")
            ->check(OneOf({"yes", "no", "unknown"}))
            ->type_name("WORD");
    }
    fnText("--user", pWish->szUser, "account of its administration pages; the password is asked for");
    pSet->add_option("--password-file", pWish->szPasswordFile, "take the password from a file's first line; -: stdin")
        ->type_name("FILE");
    pSet->add_flag("--ask-password", pWish->blAskPassword, "ask for the password at the terminal");
    fnText("--conn-type", pWish->szConnType, "how its administration pages are reached, such as http");
    fnText("--conn-port", pWish->szConnPort, "their port")->check(NumberBetween(1, 65535))->type_name("PORT");
    pSet->add_option("--max-rules", pWish->nMaxRules, "how many rules it holds (UPnP, NAT-PMP); 0: unknown")
        ->check(NumberBetween(0, 65535))
        ->type_name("NUMBER");
    pSet->footer(
        "A router that is driven by UPnP or NAT-PMP needs no account and no connection; a router that has neither "
        "needs both, and a description ('tavoportmap routers'). The account is kept for the day when UPnP or NAT-PMP "
        "is switched off again.\n"
        "Examples:\n"
        "  sudo tavoportmap router set --brand Acme --model R1 --upnp yes --max-rules 32\n"
        "  sudo tavoportmap router set --user admin --conn-type http --conn-port 80\n");
    pSet->callback([pWish, &request] { request.fnCommand = [pWish] { return Set(*pWish); }; });
}

}  // namespace

void OfferRouter(CLI::App& app, Request& request) {
    CLI::App* pRouter = AddCommand(app, "router", "the router: its stored settings (show, set), its table");
    pRouter->require_subcommand(1);
    pRouter->footer("'sudo tavoportmap setup' finds out what the router is and stores it; 'set' says it by hand.\n");
    const auto pShowPassword = std::make_shared<bool>(false);
    CLI::App* pShow = AddCommand(*pRouter, "show", "what is stored for the current gateway");
    pShow->add_flag("--show-password", *pShowPassword, "show the password, too");
    pShow->callback(
        [pShowPassword, &request] { request.fnCommand = [pShowPassword] { return Show(*pShowPassword); }; });
    OfferRouterTable(*pRouter, request);
    OfferSet(*pRouter, request);
}

}  // namespace tavo::cli
