/*
 * libtavoportmap: finds out what the home router in front of the box is, keeps its settings and writes
 * the box's port-forwarding rules into it.
 *
 * The flat functions take plain records and can be called from C11 and C++; classes and what needs references
 * stand under __cplusplus. Nothing is thrown. Records passed in belong to the caller and are only read or filled.
 * Arrays and lists handed out are malloc blocks of the caller's, released with the function named beside them.
 * Texts are NUL-terminated; a text that does not fit a field is cut.
 *
 * Return values, by name:
 *   0 done, -1 failed            TLib*, TestFunc*, DETECT_INFO::*, but for those below
 *   1 done, 0 failed             class members (or true and false); GetGatewayIP, lock_file, SplitRouterName,
 *                                IsGenericRouterName, PF_CONF::* (but for FreeArray), SetDetectManualCache;
 *                                TLibGetRouterDBList, TLibFreeRouterDBList, TLibUpdateRouterDBList (-1: null argument)
 *   an answer                    IsSavingRules (1 or 0), IGetCurrSyntaxVersion (a number or -1), TLibGetRouterConf
 *                                (1: nothing stored), TLibTavoPortMapRulesSet, TLibTavoPortMapRouterDetect,
 *                                TLibTestUpnpCompatibility (1 and 2, see there)
 * Most failures leave one or more lines in the system log, all of priority error; so does some success.
 *
 * Calls run and call back on the caller's thread, one at a time: a process has one router lock, one UPnP client
 * and one time limit. TLibTestRules has a thread of its own for its duration. TLibDetectRouter forks, and whatever
 * runs a tool does. Most calls need root.
 */
#ifndef LIBTAVOPORTMAP_H
#define LIBTAVOPORTMAP_H

#include <stdbool.h>
#include <stddef.h>

#ifdef __cplusplus
#include <json/value.h>

#include <list>
#include <string>
#endif

#if defined(__GNUC__)
#define TAVO_API __attribute__((visibility("default")))
#else
#define TAVO_API
#endif

#ifdef __cplusplus
#define TAVO_LAYOUT static_assert
#define TAVO_ENUM_INT : int /* any value that a caller hands in is a value of the enum */
extern "C" {
#else
#define TAVO_LAYOUT _Static_assert
#define TAVO_ENUM_INT
#endif

/* ---- enums; the values are fixed, a record stores them in four bytes ---------------------------- */

/* Whether the router supports a protocol; as text "no", "yes", "unknown". */
typedef enum __tag_TAVO_ROUTER_SUPPORT TAVO_ENUM_INT {
    TAVO_ROUTER_SUPPORT_NO = 0,
    TAVO_ROUTER_SUPPORT_YES = 1,
    TAVO_ROUTER_SUPPORT_UNKNOWN = 2
} __tag_TAVO_ROUTER_SUPPORT;

/* What the library is busy with. */
typedef enum __tag_TAVO_LIBTAVOPORTMAP_TASK TAVO_ENUM_INT {
    TAVO_LIBTAVOPORTMAP_TASK_IDLE = 0,
    TAVO_LIBTAVOPORTMAP_TASK_TESTING = 1, /* a UPnP compatibility test */
    TAVO_LIBTAVOPORTMAP_TASK_SAVING = 2   /* rules are being saved to the router */
} __tag_TAVO_LIBTAVOPORTMAP_TASK;

/* Why a getter or setter failed; look at the return value first. */
typedef enum __tag_TAVO_LIBTAVOPORTMAP_ERR TAVO_ENUM_INT {
    TAVO_LIBTAVOPORTMAP_ERR_NONE = 0,
    TAVO_LIBTAVOPORTMAP_ERR_FAILED = 1,
    TAVO_LIBTAVOPORTMAP_ERR_CONFLICT = 2,      /* another operation holds the router lock */
    TAVO_LIBTAVOPORTMAP_ERR_NO_WAN = 3,        /* detection only */
    TAVO_LIBTAVOPORTMAP_ERR_DNS = 4,           /* detection only */
    TAVO_LIBTAVOPORTMAP_ERR_SYNTAX_VERSION = 6 /* the router database is newer than the forward tool */
} __tag_TAVO_LIBTAVOPORTMAP_ERR;

/* What is known of the gateway; as text "unknown", "not_initialized", "upnp_natpmp", "manual". */
typedef enum __TAG_TAVO_ROUTER_INIT_STATE TAVO_ENUM_INT {
    TAVO_ROUTER_INIT_STATE_UNKNOWN = 0,
    TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED = 1,
    TAVO_ROUTER_INIT_STATE_UPNP_NATPMP = 2,
    TAVO_ROUTER_INIT_STATE_MANUAL = 3
} __TAG_TAVO_ROUTER_INIT_STATE;

/* What stood in the way of a save (2 to 12) or of a compatibility test (2, 13 to 20); nStatus of their records. */
typedef enum TAVO_ROUTER_STATUS TAVO_ENUM_INT {
    TAVO_ROUTER_STATUS_NONE = 0, /* nothing that has a number; look at the return value and the log */
    TAVO_ROUTER_STATUS_LOCKED = 2,
    TAVO_ROUTER_STATUS_TOO_MANY_RULES = 7, /* more than the router holds */
    TAVO_ROUTER_STATUS_PORT_CONFLICT = 8,
    TAVO_ROUTER_STATUS_ADD_FAILED = 9,
    TAVO_ROUTER_STATUS_PORT_LIMIT = 10,    /* 10 to 12: more than the router's pages hold; single ports, */
    TAVO_ROUTER_STATUS_NO_RANGE_PAGE = 11, /* places, each for one port or one range, */
    TAVO_ROUTER_STATUS_RANGE_LIMIT = 12,   /* single ports and ranges */
    TAVO_ROUTER_STATUS_NO_GATEWAY = 13,    /* none that speaks UPnP */
    TAVO_ROUTER_STATUS_TEST_ADD = 14,      /* 14 to 20: the failed step, only for a router without a name */
    TAVO_ROUTER_STATUS_TEST_MAX = 15,
    TAVO_ROUTER_STATUS_TEST_DELETE = 16,
    TAVO_ROUTER_STATUS_TEST_OPEN_PORTS = 17,
    TAVO_ROUTER_STATUS_TEST_CLOSED_PORTS = 18,
    TAVO_ROUTER_STATUS_TEST_READD = 19,
    TAVO_ROUTER_STATUS_TEST_TERMINAL = 20
} TAVO_ROUTER_STATUS;

TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_SUPPORT) == 4, "four bytes");
TAVO_LAYOUT(sizeof(__tag_TAVO_LIBTAVOPORTMAP_TASK) == 4, "four bytes");
TAVO_LAYOUT(sizeof(__tag_TAVO_LIBTAVOPORTMAP_ERR) == 4, "four bytes");
TAVO_LAYOUT(sizeof(__TAG_TAVO_ROUTER_INIT_STATE) == 4, "four bytes");
TAVO_LAYOUT(sizeof(TAVO_ROUTER_STATUS) == 4, "four bytes");

/* ---- records ------------------------------------------------------------------------------------ */

enum { TAVO_TEXT_SIZE = 1024 }; /* bytes of every text field, the NUL included */

/* One port-forwarding rule. Ports: one port, a list or ranges, as stored. */
typedef struct __tag_TAVO_ROUTER_RULE {
    char szRuleID[TAVO_TEXT_SIZE]; /* section name in rule.conf */
    bool blEnable;
    char szProtocol[TAVO_TEXT_SIZE];
    char szRouterPort[TAVO_TEXT_SIZE];
    char szSrcPort[TAVO_TEXT_SIZE];
    char szServiceID[TAVO_TEXT_SIZE]; /* empty when absent */
    char szServiceName[TAVO_TEXT_SIZE];
    int enTestStatus; /* 0 not tested, 1 disabled, 2 ok, 3 fail; 0 in arrays read from files */
} __tag_TAVO_ROUTER_RULE;
TAVO_LAYOUT(sizeof(bool) == 1, "one byte");
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_RULE, szProtocol) == 1025, "rule layout");
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_RULE, enTestStatus) == 6148, "rule layout");
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_RULE) == 6152, "rule layout");

/* The settings of the router behind one gateway address. */
typedef struct __tag_TAVO_ROUTER_CONF {
    char szBrand[TAVO_TEXT_SIZE];
    char szModel[TAVO_TEXT_SIZE];
    char szVersion[TAVO_TEXT_SIZE];
    char szSupportUpnp[TAVO_TEXT_SIZE];   /* "yes", "no" or "unknown" */
    char szSupportNatpmp[TAVO_TEXT_SIZE]; /* "yes", "no" or "unknown" */
    char szUser[TAVO_TEXT_SIZE];
    char szPass[TAVO_TEXT_SIZE];
    char szConnType[TAVO_TEXT_SIZE];
    char szConnPort[TAVO_TEXT_SIZE];
    char szMaxRule[TAVO_TEXT_SIZE]; /* decimal; only ever read */
} __tag_TAVO_ROUTER_CONF;
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_CONF) == 10 * 1024UL, "settings layout");

/* Outcome and progress of router detection. */
typedef struct __tag_TAVO_ROUTER_DETECT_RESULT {
    int nProgress;      /* percent */
    int errCode;        /* __tag_TAVO_LIBTAVOPORTMAP_ERR */
    int nEnvFlags;      /* 1: gateway setting wrong; 2: public IP level unknown; 4: more than one NAT */
    int nPublicIPLevel; /* -1 when it could not be read */
    char szGateway[TAVO_TEXT_SIZE];
    char szInterface[TAVO_TEXT_SIZE];
    int enSupportUpnp;   /* __tag_TAVO_ROUTER_SUPPORT */
    int enSupportNatpmp; /* __tag_TAVO_ROUTER_SUPPORT */
    char szBrand[TAVO_TEXT_SIZE];
    char szModel[TAVO_TEXT_SIZE];
    char szVersion[TAVO_TEXT_SIZE];
    char szUpnpPfPath[TAVO_TEXT_SIZE];
    char szUserSettingName[TAVO_TEXT_SIZE];
    int nMaxRule; /* -1 when unknown */
} __tag_TAVO_ROUTER_DETECT_RESULT;
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_DETECT_RESULT, enSupportUpnp) == 16 + 2 * 1024, "detect layout");
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_DETECT_RESULT) == 28 + 7 * 1024, "detect layout");

/* What a router model's own pages can do. */
typedef struct __tag_TAVO_ROUTER_DESC {
    bool blSupportChangePort; /* the router port of a rule may differ from the box port */
} __tag_TAVO_ROUTER_DESC;
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_DESC) == 1, "description layout");

/* The known router models, a singly linked list released with TLibFreeRouterDBList. */
typedef struct __tag_TAVO_ROUTERDB_LIST {
    char szBrand[TAVO_TEXT_SIZE];
    char szModel[TAVO_TEXT_SIZE];
    char szVersion[TAVO_TEXT_SIZE];
    int blGeneric; /* 1: the description is not tied to a firmware version */
    struct __tag_TAVO_ROUTERDB_LIST* pNext;
} __tag_TAVO_ROUTERDB_LIST;
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTERDB_LIST, blGeneric) == 3 * 1024UL, "list layout");
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTERDB_LIST, pNext) % sizeof(void*) == 0, "list layout");

/* Progress and outcome of saving rules. Set nStatus to 0 before the call: the save never resets it. */
#if defined(__clang__)
#pragma clang diagnostic push
#pragma clang diagnostic ignored "-Wnested-anon-types" /* knows no __extension__ here */
#endif
typedef struct __tag_TAVO_ROUTER_SAVE_RULE_RESULT {
    int nProgress; /* percent: 20, 40, 60, 80, 90, 100 */
    int nStatus;   /* TAVO_ROUTER_STATUS */
    union {
        char szPortList[TAVO_TEXT_SIZE]; /* 8 and 9: the refused mappings */
        __extension__ struct {
            int nLimit;  /* 7, 10, 11, 12: the limit; -1 unknown cause */
            int nLimit2; /* 12: the range limit */
        };
    };
} __tag_TAVO_ROUTER_SAVE_RULE_RESULT;
#if defined(__clang__)
#pragma clang diagnostic pop
#endif
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_SAVE_RULE_RESULT, szPortList) == 8, "save layout");
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_SAVE_RULE_RESULT, nLimit) == 8, "save layout");
TAVO_LAYOUT(offsetof(__tag_TAVO_ROUTER_SAVE_RULE_RESULT, nLimit2) == 12, "save layout");
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_SAVE_RULE_RESULT) == 8 + 1024, "save layout");

/* Progress and outcome of the UPnP compatibility test. */
typedef struct __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT {
    int nProgress; /* percent: 10, 20, 30, 60, 40, 50, 70, 80, 90, 100 */
    int nStatus;   /* TAVO_ROUTER_STATUS */
    char szBrand[TAVO_TEXT_SIZE];
    char szModel[TAVO_TEXT_SIZE];
    char szVersion[TAVO_TEXT_SIZE];
    char szSupport[TAVO_TEXT_SIZE]; /* "yes" or "no" */
    int nMaxRule;                   /* -1 when the test failed */
} __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT) == 12 + 4 * 1024, "test layout");

/* One test record for the UPnP compatibility database. */
typedef struct __tag_TAVO_ROUTER_RECORD {
    char szBrand[TAVO_TEXT_SIZE];
    char szModel[TAVO_TEXT_SIZE];
    char szVersion[TAVO_TEXT_SIZE];
    char szSupport[TAVO_TEXT_SIZE];
    int nMaxRule; /* -1 unknown */
} __tag_TAVO_ROUTER_RECORD;
TAVO_LAYOUT(sizeof(__tag_TAVO_ROUTER_RECORD) == 4 + 4 * 1024, "record layout");

/* One port request of the relay service. */
typedef struct __tag_TAVO_PORTMAP_RULE {
    int nTestConnStatus; /* 0 not tested, 1 disabled, 2 ok, 3 fail */
    char szPorts[TAVO_TEXT_SIZE];
    int enProtocol; /* 0 tcp, 1 udp, 2 all */
} __tag_TAVO_PORTMAP_RULE;
TAVO_LAYOUT(sizeof(__tag_TAVO_PORTMAP_RULE) == 8 + 1024, "request layout");

/* A parsed section of a configuration file, and a string hash, of the platform's libraries. */
struct _tag_tavo_pf_conf;
struct tag_TLIBC_SZHASH;

/* ---- support words, rule arrays ----------------------------------------------------------------- */

/* Writes "no", "yes" or "unknown", cut at nOutSize - 1. -1: null szOut. An unlisted value is logged,
 * leaves szOut as it was and still gives 0. */
TAVO_API int TLibSupportEnumToString(char* szOut, int nOutSize, __tag_TAVO_ROUTER_SUPPORT enSupport);
/* The reverse, case-sensitive. -1: a null argument or another text; the output is untouched. */
TAVO_API int TLibSupportStringToEnum(__tag_TAVO_ROUTER_SUPPORT* pEnSupport, const char* szSupport);
/* Releases an array of TLibGetRulesArrFrom*; NULL is fine. Always 0. */
TAVO_API int TLibFreeRulesArr(__tag_TAVO_ROUTER_RULE* pRules);

/* ---- locks and busy state ----------------------------------------------------------------------- */

/* Takes the router lock for this process, without waiting. 0: taken; -1: held elsewhere, which is not logged.
 * While it is held, call the other functions with blLock false, and none that takes the lock itself
 * (TLibTavoPortMapRulesSet, TLibTavoPortMapRouterDetect, TLibUploadTestUpnpCompatibilityFailResult). */
TAVO_API int TLibTavoPortMapLock(void);
/* Gives it back; one unlock for one lock (a further one closes that descriptor number again, whatever it
 * is by then). Always 0. */
TAVO_API int TLibTavoPortMapUnLock(void);
/* What is running now, in any process; a detection does not show. -1: null pointer. */
TAVO_API int TLibGetLibTavoPortMapRunningTask(__tag_TAVO_LIBTAVOPORTMAP_TASK* pEnTask);
/* 1: rules are being written to the router; 0: not. */
TAVO_API int IsSavingRules(void);
TAVO_API void unlock_file(int fd);

/* ---- gateway address ---------------------------------------------------------------------------- */

/* The default gateway's IPv4 address as text, cut at nSize - 1. */
TAVO_API int TLibGetGatewayIP(char* szOutGatewayIP, int nSize);

/* ---- rule files --------------------------------------------------------------------------------- */

/* The rules of rule.conf (testrule.conf) as one array: *ppRules must be NULL on entry and is released
 * with TLibFreeRulesArr. szIdList: only these rules, NULL for all; -1 where no rule has one of the ids. An absent or
 * empty file gives 0 rules and NULL. pErr may be NULL; it is 2 when blLock asked for the router lock and it was held.
 * Each call that finds rules keeps some two kilobytes a rule for good: do not poll with it. */
TAVO_API int TLibGetRulesArrFromRuleConf(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, char* szIdList, bool blLock,
                                         __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr);
TAVO_API int TLibGetRulesArrFromTestRuleConf(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, char* szIdList,
                                             bool blLock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr);
/* Both of the above: rule.conf when blRuleConf, else testrule.conf. */
TAVO_API int GetRulesArrFromConfFile(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, bool blRuleConf, char* szIdList,
                                     bool blLock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr);

/* ---- router description database ------------------------------------------------------------------ */

/* These three answer -1 for a null argument, else 1 for success and 0 for failure. The list: also 1, and NULL, where
 * no descriptions are installed. The update: also 1 where no server is named; *pnVersion is the edition that is
 * installed then. */
TAVO_API int TLibGetRouterDBList(__tag_TAVO_ROUTERDB_LIST** pplRouterDBList);
TAVO_API int TLibFreeRouterDBList(__tag_TAVO_ROUTERDB_LIST* plRouterDBList);
TAVO_API int TLibUpdateRouterDBList(int* pnVersion);
/* Looks for what the router's own pages can do, and finds nothing: 0 with blSupportChangePort false for a router
 * with UPnP or NAT-PMP and for one that is not stored; -1 for one that is driven through its pages (the section is
 * looked for under an empty name, which is kept; RouterDB has the answer). pErr may be NULL; it is 1 on every path
 * (success too), 2 when the lock was held. */
TAVO_API int TLibGetRouterDesc(const char* szGwRouterIP, __tag_TAVO_ROUTER_DESC* routerDesc,
                               __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr, bool blLock);
/* Rule syntax version of the installed port-forward tool; -1 when it tells none. */
TAVO_API int IGetCurrSyntaxVersion(void);

/* ---- router settings ------------------------------------------------------------------------------ */

/* The settings of the router behind szGwRouterIP; zero the record first: a field that is not stored, or
 * that this kind of router does not have, keeps what it held. 0: filled; 1: nothing is stored for this
 * gateway; -1: failed, which may mean that only the limit is not known: all other fields are filled then. A
 * router.conf that cannot be parsed is DELETED, with the account in it, and 1 is answered; the relay service's calls
 * read through this one. pErr may be NULL: 0, or 2 when blLock asked for the router lock and it was held. */
TAVO_API int TLibGetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf,
                               __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr, bool blLock);
/* Makes the record the only section of router.conf, named by the current gateway. Account and connection
 * are stored for a manual router only (neither support word is "yes"), szMaxRule never. 0 or -1; a
 * failure leaves a manual router's settings as they were, and no settings where the write of another
 * router's failed. pErr may be NULL: 1, also after success; 2: the lock was held;
 * 6: the router's description is newer than the port-forward tool. */
TAVO_API int TLibSetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf,
                               __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr, bool blLock);

/* ---- detection ------------------------------------------------------------------------------------ */

/* Finds out what the gateway is; takes several seconds, more where a download server is slow. The callback is called
 * on this thread after each change of nProgress and once at the end, with NULL when detectResult is NULL; nProgress
 * becomes 100 only after the last call. 0 or -1; errCode has the reason where it is one of its values, else it is 0
 * and the log has it (interface down, no limit known, no child). On its way it deletes the detection cache, restarts
 * avahi, and switches runupnpportmapping or runnatpmpportmapping of /etc/tavoinfo.conf off where the router
 * does not answer by that protocol: the daemon then takes its mappings away at its next start or SIGHUP, and whoever
 * does not store the result should put the keys back. One child process is forked; where that child cannot tell the
 * gateway's address it returns from this function with -1: a caller that must not be doubled compares its pid. */
TAVO_API int TLibDetectRouter(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult,
                              void (*pfnCallback)(const __tag_TAVO_ROUTER_DETECT_RESULT*, void*), void* arg,
                              bool blLock);
/* What the last detection, of any process, found; nProgress to szInterface are not filled. 0 or -1. */
TAVO_API int TLibGetRouterDetectResult(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult);

/* ---- saving rules ------------------------------------------------------------------------------- */

/* Makes rgRules the rule set of the box and writes it to the router: by UPnP, by NAT-PMP or through its own pages, as
 * the FIRST section of router.conf says, whatever gateway that names; szGwRouterIP counts for the limits of pages
 * only. Waits up to about five minutes; without rules, and with none that is on, not at all. Both run keys of
 * /etc/tavoinfo.conf are off from the beginning until the daemon is started, and stay so after a failure: put them
 * back where rule.conf was not changed. Through pages, what the router refused is not in the result but in
 * /run/tavo/tavoportforward.json and the event log. saveResult may be NULL only without pfnCallback and without blLock.
 * The callback is called on this thread after each change of nProgress, never with a failure. */
TAVO_API int TLibSaveRules(const char* szGwRouterIP, int nRules, __tag_TAVO_ROUTER_RULE* rgRules, bool blLock,
                           __tag_TAVO_ROUTER_SAVE_RULE_RESULT* saveResult,
                           void (*pfnCallback)(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT*, void*), void* pData);

/* ---- relay service ------------------------------------------------------------------------------ */

/* Replaces the rules of the service szServiceName by nRules requests (0 and NULL: takes them all out), keeps
 * what the user's rules and other hosts' mappings hold, and saves the outcome to the router; waits as
 * TLibSaveRules does. Takes the router lock itself. blTestConnection: then tests every port asked for, also
 * those that somebody else keeps, and writes each request's nTestConnStatus. 0; 1: the router has not been
 * detected; 2: the lock is held; -1: failed. rule.conf is as before unless the save came as far as writing
 * it; a test that fails leaves the new rules in place. Not refused: an enProtocol above 2 (stored without a
 * protocol, so that later calls fail until rule.conf is mended), and a request whose ports make a text
 * ("80-82, 90") that does not fit a rule: it is cut there, maybe inside a number, and logged. */
TAVO_API int TLibTavoPortMapRulesSet(const char* szServiceName, __tag_TAVO_PORTMAP_RULE* rgRules, int nRules,
                                     bool blTestConnection);
/* Has the router in front classified, once: later calls answer what is stored. Takes the router lock itself;
 * a detection takes several seconds, the compatibility test of an unknown router minutes. 0: it maps ports
 * by itself; 1: it is a manual router; 2: the lock is held; -1: failed. As from TLibDetectRouter, a child
 * that cannot tell the gateway's address returns too, with -1 and without the lock. */
TAVO_API int TLibTavoPortMapRouterDetect(void);

/* ---- relay service: diagnostics, what they find goes to standard output ----------------------------- */

/* At most ten numbers ("1,2,3,7") as a port list ("1-3, 7"), cut at nOut - 1. 0 or -1. */
TAVO_API int TestFuncToPorts(char* szOut, int nOut, const char* szNumbers);
/* Prints the rules of rule.conf with their ports taken apart. 0 or -1. */
TAVO_API int TestFuncCreateOpRulesByRuleConf(void);
/* These take a service's request as text: "hoplink;5000-5001;tcp;6000;udp", nine pairs at most. 0 or -1. */
/* Tests the ports from outside; saves nothing. */
TAVO_API int TestFuncTestRules(const char* szRequest);
/* Shows what the request loses to other hosts' mappings on a UPnP router; changes nothing. */
TAVO_API int TestFuncDeleteConflictPortsForUPnPRouter(const char* szRequest);
/* TLibTavoPortMapRulesSet with a test, and its statuses; 0 also where that answered 1 or 2. */
TAVO_API int TestFuncSetRules(const char* szRequest);

/* ---- router tests -------------------------------------------------------------------------------- */

/* Whether the gateway's UPnP can be used: makes nMaxRule (at least 3) test mappings, counts, deletes and
 * makes them anew, and looks whether the ports follow: from outside where a port checker is named, else by the
 * router's table; takes minutes. 0: passed; 1: a step failed, and testCompResult says "no"; -1: the test could not
 * run (nStatus 2: locked; 13: no gateway that speaks UPnP). A call that is refused, for a bad argument or because a
 * test runs, ENDS the test that runs. The callback is called on this thread after each change of nProgress. */
TAVO_API int TLibTestUpnpCompatibility(int nMaxRule, __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT* testCompResult,
                                       void (*pfnCallback)(const __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT*, void*),
                                       void* pData, bool blLock);
/* Ends a test that runs, in any process, and deletes its files, also when none runs: with them upnpd's result file
 * and /var/log/router.log. Always 0. */
TAVO_API int TLibStopTestUpnpCompatibility(void);
/* Keeps the outcome of a test as the user's own entry of the compatibility database, its only one. 0 or -1. */
TAVO_API int TLibWriteRecordIntoUpnpDB(const __tag_TAVO_ROUTER_RECORD* record);
/* Sends the files of a failed test to the report server; the archive stays in /tmp. Takes the router lock itself; while
 * it packs, router.conf holds other settings. 0 or -1. */
TAVO_API int TLibUploadTestUpnpCompatibilityFailResult(void);
/* Makes the port connection test ready; needed before the first TLibTestRules, and again after
 * a compatibility test. 0 or -1. */
TAVO_API int TLibTestRulesInit(void);
/* Tests from outside whether the rules' ports reach the box and writes each rule's enTestStatus; -1 leaves
 * them as they were. err may be NULL: 0, or 2 when blLock asked for the router lock and it was held. */
TAVO_API int TLibTestRules(int nRules, __tag_TAVO_ROUTER_RULE* rgRules, __tag_TAVO_LIBTAVOPORTMAP_ERR* err,
                           bool blLock);

#ifdef __cplusplus
/* ---- relay service: ports, C linkage though not for C ------------------------------------------- */

/* Appends the ports of a text ("80,443,8000-8010"; a range written backwards counts forwards) in their
 * order, duplicates kept. 0, or -1: null, no port at all, or one outside 1 to 65535; what stood before it
 * has been appended. */
TAVO_API int TLibParsePorts(std::list<int>& ports, const char* szPort);
/* The same. */
TAVO_API int TestFuncTLibParsePorts(std::list<int>& ports, char* szPort);
/* Appends the outside ports that enabled mappings of other hosts hold on the UPnP router in front, which
 * it searches for at most 30 seconds. 0 (also without mappings, and where the table cannot be read), or -1: no router,
 * no gateway, or no address of the box's on its subnet. */
TAVO_API int TestFuncGetUsedRouterPortList(std::list<int>& tcpPorts, std::list<int>& udpPorts);
} /* extern "C" */

/* Opens (creating it) and locks szPath without waiting; fd receives the descriptor also when the lock
 * is held elsewhere: pass it to unlock_file in every case. 1: locked; 0: not. */
TAVO_API int lock_file(const char* szPath, int& fd);
/* The default gateway's IPv4 address. 1: set; 0: there is none. */
TAVO_API int GetGatewayIP(std::string& ip);

/* "brand: model(version)" or "brand: model" into its three parts. */
TAVO_API bool SplitRouterName(char* szName, std::string& brand, std::string& model, std::string& version);
/* Whether a router name carries no version. */
TAVO_API bool IsGenericRouterName(bool& isGeneric, char* szName);

/* Accessors of one parsed rule section. Every one answers 0 for a null node, and but for GetRuleID for an empty one. */
namespace PF_CONF {
TAVO_API int IsRuleEnable(bool& blEnable, const _tag_tavo_pf_conf* pConf);
TAVO_API int GetRuleID(std::string& id, const _tag_tavo_pf_conf* pConf);
TAVO_API int GetRuleProtocol(std::string& protocol, const _tag_tavo_pf_conf* pConf);
/* Empty when the rule has none. */
TAVO_API int GetRuleServiceID(std::string& serviceID, const _tag_tavo_pf_conf* pConf);
/* Unchanged when the rule has none. */
TAVO_API int GetRuleServiceName(std::string& serviceName, const _tag_tavo_pf_conf* pConf);
/* Both outputs or none. */
TAVO_API int GetRulePort(std::string& routerPort, std::string& srcPort, const _tag_tavo_pf_conf* pConf);
/* extra is never written. */
TAVO_API int GetRuleInfo(std::string& id, bool& blEnable, std::string& routerPort, std::string& srcPort,
                         std::string& protocol, std::string& serviceID, std::string& extra,
                         const _tag_tavo_pf_conf* pConf);
/* The list as one array, released with FreeArray; *ppRules must be NULL on entry. A rule without a
 * service name gets the one of the rule before it. */
TAVO_API int ToArray(int& nCount, __tag_TAVO_ROUTER_RULE** ppRules, const _tag_tavo_pf_conf* pHead);
/* Always 0. */
TAVO_API int FreeArray(__tag_TAVO_ROUTER_RULE* pRules);
}  // namespace PF_CONF

/* One snapshot of router.conf and the section of one gateway in it. */
class TAVO_API RouterConfReader {
public:
    /* The section named gatewayIP. */
    explicit RouterConfReader(const std::string& gatewayIP);
    /* The first section. */
    RouterConfReader();
    ~RouterConfReader();
    RouterConfReader(const RouterConfReader&) = delete;
    RouterConfReader& operator=(const RouterConfReader&) = delete;

    /* 0 when the file could not be loaded. */
    int IsSectionExist(bool& blExist);
    int GetSectionName(std::string& name);
    /* 0 without a section; a missing key is success and leaves the output unchanged. */
    int GetBrand(std::string& brand);
    int GetModel(std::string& model);
    int GetVersion(std::string& version);
    int GetUser(std::string& user);
    int GetPass(std::string& pass);
    int GetConnType(std::string& connType);
    int GetConnPort(std::string& connPort);
    int GetSupportUpnp(std::string& support);
    int GetSupportNatpmp(std::string& support);
    /* True exactly for "yes". */
    int GetSupportUpnp(bool& blSupport);
    int GetSupportNatpmp(bool& blSupport);
    /* 0 also without a "max" key. */
    int GetMaxRule(int& nMaxRule);

private:
    _tag_tavo_pf_conf* mPHead;
    _tag_tavo_pf_conf* mPCurrent;
};

/* Builds the section of the current gateway and replaces router.conf with it. */
class TAVO_API RouterConfWriter {
public:
    /* blReload: keep the gateway's old section and those of other gateways; else only the new section
     * is written. Nothing is loaded before the first setter. */
    explicit RouterConfWriter(bool blReload);
    ~RouterConfWriter();
    RouterConfWriter(const RouterConfWriter&) = delete;
    RouterConfWriter& operator=(const RouterConfWriter&) = delete;

    int Init();
    int IsValid();
    int ReloadOldSection(const std::string& gatewayIP);
    int CreateNewSection(const std::string& gatewayIP);
    int SetBrand(const std::string& brand);
    int SetModel(const std::string& model);
    int SetVersion(const std::string& version);
    int SetBrandModelVersion(const std::string& brand, const std::string& model, const std::string& version);
    int SetUser(const std::string& user);
    int SetPass(const std::string& pass);
    int SetUserPass(const std::string& user, const std::string& pass);
    int SetConnType(const std::string& connType);
    int SetConnPort(const std::string& connPort);
    int SetMaxRule(int nMaxRule);
    /* Also claims the router type. */
    int SetSupportUpnp(const std::string& support);
    int SetSupportNatpmp(const std::string& support);
    /* Replaces router.conf; a failure leaves the old one. */
    int Sync();

private:
    bool mBlReload;
    bool mBlInit;
    _tag_tavo_pf_conf* mPHead;
    _tag_tavo_pf_conf* mPCurrent;
};

/* Walks one snapshot of a rule file: StartNextRule(), then NextRule() while it answers 1. */
class TAVO_API RouterRuleConfReader {
public:
    /* true: testrule.conf; false: rule.conf. */
    explicit RouterRuleConfReader(bool blTestRule);
    ~RouterRuleConfReader();
    RouterRuleConfReader(const RouterRuleConfReader&) = delete;
    RouterRuleConfReader& operator=(const RouterRuleConfReader&) = delete;

    int StartNextRule();
    int NextRule();
    int GetRulesNumber(int& nRules);
    int IsRuleEnable(bool& blEnable);
    int GetRuleID(std::string& id);
    int GetRuleProtocol(std::string& protocol);
    int GetRulePort(std::string& routerPort, std::string& srcPort);
    int GetRuleServiceID(std::string& serviceID);
    int GetRuleServiceName(std::string& serviceName);
    int GetRuleInfo(bool& blEnable, std::string& routerPort, std::string& srcPort, std::string& protocol,
                    std::string& serviceID);

private:
    _tag_tavo_pf_conf* mPHead;
    _tag_tavo_pf_conf* mPCurrent;
    bool mBlTestRule;
};

/* Builds a whole rule file. */
class TAVO_API RouterRuleConfWriter {
public:
    RouterRuleConfWriter();
    ~RouterRuleConfWriter();
    RouterRuleConfWriter(const RouterRuleConfWriter&) = delete;
    RouterRuleConfWriter& operator=(const RouterRuleConfWriter&) = delete;

    int AddRule(const std::string& id, bool blEnable, const std::string& routerPort, const std::string& srcPort,
                const std::string& protocol, const std::string& serviceID, const std::string& serviceName);
    int AddRule(int nId, bool blEnable, const std::string& routerPort, const std::string& srcPort,
                const std::string& protocol, const std::string& serviceID, const std::string& serviceName);
    /* Replaces rule.conf; a failure puts the old one back. */
    int Sync();
    int Sync(const std::string& path);
    int GetRules(int& nRules);
    /* Jobs for single ports and for ranges that the rules need on the router at gatewayIP. */
    int GetPorts(int& nPorts, const std::string& gatewayIP);
    int GetRange(int& nRange, const std::string& gatewayIP);
    /* The list stays the writer's. */
    int GetRuleConf(_tag_tavo_pf_conf** pRuleConfHead);
    int ToArray(int& nCount, __tag_TAVO_ROUTER_RULE** ppRules);

private:
    _tag_tavo_pf_conf* mPHead;
    _tag_tavo_pf_conf* mPTail;
};

/* What the description database says of the manual router behind a gateway address. */
class TAVO_API RouterDB {
public:
    explicit RouterDB(const std::string& gwRouterIP);
    ~RouterDB();
    RouterDB(const RouterDB&) = delete;
    RouterDB& operator=(const RouterDB&) = delete;

    /* Builds the flat description; the accessors call it when needed. */
    bool GetRouterDesc();
    bool GetSyntaxVersion(int& nVersion);
    bool GetMaxPorts(int& nMaxPorts);
    bool GetMaxRange(int& nMaxRange);
    bool IsSupportChangePort(bool& blSupport);
    bool IsSupportPageRange(bool& blSupport);
    static bool List(__tag_TAVO_ROUTERDB_LIST** pplRouterDBList);
    static bool FreeList(__tag_TAVO_ROUTERDB_LIST* plRouterDBList);
    static bool Update(int& nVersion);

private:
    std::string mSzGwRouterIP;
    int mBlLoaded;
    Json::Value mJsDesc;
};

/* What the UPnP compatibility databases, downloaded and the user's own, say of one router model. */
class TAVO_API RouterUpnpDB {
public:
    RouterUpnpDB(const std::string& brand, const std::string& model, const std::string& version);
    ~RouterUpnpDB();

    /* False for an empty brand, model and version. Fetches the downloaded database where its file is missing, at every
     * call. */
    bool IsValid();
    /* "yes", "no" or "unknown". */
    bool GetSupport(std::string& support);
    /* Rules that the router holds; false with -1 when unknown. */
    bool GetMaxRule(int& nMaxRule);
    /* Name of the matching router description. */
    bool GetPfpath(std::string& pfpath);
    static bool Update(int& nVersion);

private:
    std::string mSzKey;
};

/* Writes the user's own test result; the file holds only the last one. */
class TAVO_API RouterUpnpDBUserWriter {
public:
    /* section: brand/model/version. */
    explicit RouterUpnpDBUserWriter(const std::string& section);
    ~RouterUpnpDBUserWriter();
    RouterUpnpDBUserWriter(const RouterUpnpDBUserWriter&) = delete;
    RouterUpnpDBUserWriter& operator=(const RouterUpnpDBUserWriter&) = delete;

    bool Init();
    bool SetSupport(const std::string& support);
    bool SetMaxRule(int nMaxRule);
    bool Sync();

private:
    std::string mSzSection;
    _tag_tavo_pf_conf* mPSection;
};

/* Where the answer of the last detection is cached, and the key that holds the router's state. */
extern "C" {
TAVO_API extern const std::string SZF_DETECT_MANUAL_CACHE;
TAVO_API extern const std::string SZ_ROUER_INIT;
}

namespace DetectCache {
/* "unknown", "not_initialized", "upnp_natpmp", "manual"; empty for another value. */
TAVO_API std::string ToString(__TAG_TAVO_ROUTER_INIT_STATE enState);
TAVO_API bool IsCacheExisted();
}  // namespace DetectCache

/* Reads one gateway's section of the detection cache. */
class TAVO_API DetectCacheReader {
public:
    explicit DetectCacheReader(const std::string& section);
    ~DetectCacheReader();
    DetectCacheReader(const DetectCacheReader&) = delete;
    DetectCacheReader& operator=(const DetectCacheReader&) = delete;

    /* Loads the section, once. */
    int Init();
    /* Loads it where that has not been done; 0 when the file could not be read. */
    int IsSectionExisted(bool& blExisted);
    /* These do not load: 0 before IsSectionExisted() or Init() found the section. */
    int GetType(__TAG_TAVO_ROUTER_INIT_STATE& enState);
    int GetBrand(std::string& brand);
    int GetModel(std::string& model);
    int GetVersion(std::string& version);

private:
    int mEnReaderState;
    tag_TLIBC_SZHASH* mPHash;
    std::string mSzSection;
};

/* Replaces the detection cache by one section. */
class TAVO_API DetectCacheWriter {
public:
    explicit DetectCacheWriter(const std::string& section);
    ~DetectCacheWriter();
    DetectCacheWriter(const DetectCacheWriter&) = delete;
    DetectCacheWriter& operator=(const DetectCacheWriter&) = delete;

    int Init();
    /* Call it after one of the other setters: it does not make the table that they fill. */
    int SetType(__TAG_TAVO_ROUTER_INIT_STATE enState);
    int SetBrand(const std::string& brand);
    int SetModel(const std::string& model);
    int SetVersion(const std::string& version);
    /* Deletes the old cache, then writes; a failure leaves no cache. */
    int Sync();

private:
    tag_TLIBC_SZHASH* mPHash;
    std::string mSzSection;
};

/* Records the gateway section as a manual router. 1 or 0. */
TAVO_API int SetDetectManualCache(const std::string& section, const std::string& brand, const std::string& model,
                                  const std::string& version);
/* Deletes the cache; always 1. */
TAVO_API int CleanDetectManualCache();

/* Whether the gateway speaks UPnP, what it is and whether it is known to work. The result outlives the
 * process; the readers show the last one, of whichever process, and an empty text where there is none. */
class TAVO_API UpnpDetector {
public:
    UpnpDetector();
    ~UpnpDetector();

    /* One detection. True also when there is no UPnP, which switches runupnpportmapping of /etc/tavoinfo.conf off;
     * false: another detection runs, the result could not be stored, or the model has no name to look up. */
    bool Start();
    std::string GetStr(const std::string& key);
    std::string GetPfPath();
    std::string GetVersion();
    std::string GetBrand();
    std::string GetModel();
    std::string GetSupportUpnp();
    bool IsAbleToGetBrandModelVersion();
};

/* Whether the gateway is a base station to be driven through NAT-PMP; as above. */
class TAVO_API NatpmpDetector {
public:
    NatpmpDetector();
    ~NatpmpDetector();

    /* One detection: restarts avahi, which may take up to 30 seconds, then about six seconds at most. True also when
     * the gateway is no such router, which switches runnatpmpportmapping off. */
    bool Start(const char* szGatewayIP);
    std::string GetStr(const std::string& key);
    std::string GetVersion();
    std::string GetBrand();
    std::string GetUserSettingName();
    std::string GetModel();
    std::string GetSupportNatpmp();
};

namespace DETECT_INFO {
/* Condenses what the two detectors stored into the record. 0, or -1: null, or a router that is supported
 * but whose maximum nobody knows. */
TAVO_API int fillRouterDetectResult(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult);
}  // namespace DETECT_INFO

/* Control of the UPnP port-mapping daemon. */
class TAVO_API UpnpDaemon {
public:
    /* False also while the daemon runs in test mode. */
    bool IsAlive();
    /* Starts the daemon, or has a running one read its rules again; the other daemon is told to stop mapping. */
    bool Start();
    /* What the router refused, appended to the texts with ", " between the items: because the port is
     * taken (conflict), or for another reason (error). Waits up to about 22 seconds. */
    bool CheckDaemon(bool& blConflict, bool& blError, std::string& strConflict, std::string& strError);
};

/* Control of the NAT-PMP port-mapping daemon. */
class TAVO_API NatpmpDaemon {
public:
    bool IsAlive();
    bool Start();
    /* The mappings that were not made: another port was offered, refused, or not answered. Waits up to about 21
     * seconds. */
    bool CheckDaemon(bool& blRemap, std::string& strRemap);
};

/* The script that applies the rules on a manual router. */
class TAVO_API PortForwardScript {
public:
    /* Runs it and waits for it; a script that ran and failed is true. */
    bool Run();
    bool IsAlive();
};
#endif /* __cplusplus */

#undef TAVO_LAYOUT
#undef TAVO_ENUM_INT
#endif /* LIBTAVOPORTMAP_H */
