/*
 * The port-forward library of the platform: rule and router files as lists of parsed sections, rule
 * and job counts, and the router description database.
 *
 * A list belongs to whoever received it and is released whole with TAVOPFConfFree. Files are written
 * as core.h says: atomically, created 0600, a failed write leaves the old file.
 */
#ifndef TAVO_PORTFORWARD_H
#define TAVO_PORTFORWARD_H

#include "tavo/core.h"

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

enum {
    TAVO_PF_NAME_SIZE = 1024,
    TAVO_PF_PORTS_SIZE = 1024,   /* of a list of ports in the library's records, with the NUL */
    TAVO_PF_MAX_SECTIONS = 16384 /* of a file: a node has a kilobyte, and one of nothing but "[]" must not eat it all */
};

/* One parsed section. Nodes and hashes are made with calloc and TLIBCSzHashAlloc. */
typedef struct _tag_tavo_pf_conf {
    char szSection[TAVO_PF_NAME_SIZE]; /* section name */
    TLIBCSzHash* pHash;                /* its pairs; NULL: an empty section */
    struct _tag_tavo_pf_conf* pNext;   /* next section in file order; NULL: the last */
} TAVO_PF_CONF;

/* The script operations of a router model; opaque to callers. */
typedef struct tag_TAVO_ROUTER_SCRIPT TAVO_ROUTER_SCRIPT;

/* Releases every node with its hash. NULL is ignored. */
void TAVOPFConfFree(TAVO_PF_CONF* pHead);

/* All sections of /etc/portforward/rule.conf (testrule.conf), in file order. NULL: no file, an empty
 * one, or one that cannot be parsed, has a section name that does not fit or more than 16384 sections
 * (the last error tells them apart: TLIBC_ERR_NONE for empty, TLIBC_ERR_NOT_FOUND for no file).
 * Blank lines and comments alone are an empty file, and are taken out of it.
 * A writer moves the old file aside, to its name and six more letters and digits (small letters, capitals and
 * digits; no two neighbours of one kind; the last one is the five's places in their kinds, summed up, plus five,
 * counted round in its own kind), before it writes the new one. Where it was killed in between,
 * the newest such copy is put back before the file is read; copies that later writes made obsolete are deleted
 * once they are ten minutes old. Any other name is a person's own copy, and left alone, but for router.conf.bak,
 * which comes back like the others. A copy of router.conf
 * whose six begin with a digit is what a report set aside: once the report is gone it comes back in the place of what
 * the report put there, unless that was changed by hand more than ten seconds later. Who sets a copy of router.conf
 * aside for longer and wants it back himself has a read lock on it (fcntl, F_OFD_SETLK): it is left to him as long as
 * he lives. */
TAVO_PF_CONF* TAVOPFRuleGet(void);
TAVO_PF_CONF* TAVOPFTestRuleGet(void);
/* The sections whose names stand in szIdList (separated by "," or blanks), in file order; NULL or an
 * empty list: all of them. NULL: as above, or nothing matches, or one of them has a list of ports ("r_port",
 * "s_port") that TAVO_PF_PORTS_SIZE does not hold: the records that are made of these sections would cut it, in the
 * middle of a number perhaps, and name ports that nobody wrote. Which rule it is, is logged. */
TAVO_PF_CONF* TAVOPFRuleGetByIdList(const char* szIdList);
TAVO_PF_CONF* TAVOPFTestRuleGetByIdList(const char* szIdList);
/* Writes the list as the whole file; a null list makes an empty file. 0: written; negative: failed. */
int TAVOPFRuleBuildByPath(const TAVO_PF_CONF* pHead, const char* szPath);
/* The same for /etc/portforward/router.conf. */
TAVO_PF_CONF* TAVOPFGwRouterConfGet(void);
int TAVOGwRouterConfSet(const TAVO_PF_CONF* pHead);

/* Number of rules in the list; nEnabledOnly non-zero: only those with "enabled" = "1". 0 for a null
 * list; negative: more rules than an int counts. */
int TLIBPFCountRuleConf(const TAVO_PF_CONF* pHead, int nEnabledOnly);
/* Number of jobs of kind szJob ("PF add port": one per single router port, "PF add range": one per
 * router port range) that the enabled rules need on the router in front (szGwRouterIP): a rule for
 * both protocols is one job where every page takes both at once, else two. 0 for a null list;
 * negative: null or unknown job name, null address, or a rule whose ports cannot be read. */
int TAVOPFCountJobNumber(const TAVO_PF_CONF* pHead, const char* szGwRouterIP, const char* szJob);
/* 1: 1 to 65535; 0: anything else. */
int TAVOPFIsValidPortNo(int nPort);

/* ---- router descriptions -------------------------------------------------------------------------
 * /etc.defaults/portforward/routerdb holds what is downloaded, /etc/tavo/routerdb what the box's owner wrote,
 * in the same form; the owner's description of a model and version comes before a downloaded one. The owner's
 * models get links in the downloaded database, for those who look there by path: RouterDBList and
 * TAVOPFRouterDBUpdate make them, where they have the right to, and take away those whose description is gone.
 */

/* Names of all known models: "brand: model(version)", or "brand: model" for a model with a "generic"
 * file; sorted. Number of names with *ppList set (caller frees); negative: no database or bad input. */
int RouterDBList(TLIBCSzList** ppList);
/* The description sections and the script operations of the router that pSection (one section of
 * router.conf: "brand", "model", "version") names. A version without a directory of its own falls
 * back to the model's "generic" version. 0: both outputs set (caller frees both); negative: unknown
 * model, unreadable file, or a name that is no plain file name; outputs untouched. */
int TAVOPFRouterDBLoadDescAndOpsByIp(const TAVO_PF_CONF* pSection, TAVO_PF_CONF** ppDesc, TAVO_ROUTER_SCRIPT** ppOps);
void TAVORouterScriptFree(TAVO_ROUTER_SCRIPT* pOps);
/* Fetches the database anew from GetRouterDBPath() and puts it in place only when it is whole, no description
 * in it needs a newer syntax than this box's, and its edition is not older than the installed one. Its edition
 * (the "version" key of the database's "version" file); negative: failed, the old one stays, which is logged
 * with the reason. Without a location nothing is attempted: the installed edition, 0 for none. */
int TAVOPFRouterDBUpdate(void);
/* Why the last TAVOPFRouterDBUpdate of this thread failed, for a person; "": it did not. */
const char* TAVOPFRouterDBWhy(void);
/* Where the databases are downloaded from (server and directory); "": nowhere. Static storage, per thread. */
const char* GetRouterDBPath(void);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
