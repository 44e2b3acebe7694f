/*
 * The UPnP compatibility test: operations that make and unmake test mappings on the gateway, and the
 * report of their progress. The mappings use ports and a description of their own; other mappings are
 * never touched. The work is done by upnpd in its test mode ("/usr/tavo/sbin/upnpd --debug -p"), which
 * these calls start and direct; it writes what became of each step into the progress file.
 */
#ifndef TAVO_UPNPTEST_H
#define TAVO_UPNPTEST_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* Has nRules test mappings made; the step is "upnp_add". 0: the work has begun; -1: it could not. */
int TAVOUPnPAddTest(int nRules);
/* How many of the test mappings the router holds, read back from its table. At least 0; -1: it could not
 * be read. */
int TAVOUPnPCountMaxRule(void);
/* Has all test mappings taken away; the step is "upnp_delete", or "upnp_terminal" where that one is
 * reported as being worked on: then the test daemon ends as well. 0: begun; -1: there is no test daemon. */
int TAVOUPnPDeletetest(void);
/* Prepares the connection test: a limit in seconds, and nFlags (reserved, 0). 0: ready; -1: not. */
int TAVOUPnPSetupTest(int nLimitSeconds, int nFlags);
/* Whether the test ports are open from outside (blAdded 1), or closed (0), as they should be. Without a
 * port checker outside, the router's own table is the judge. 0: as they should be; -1: not so. */
int TAVOUPnPPortTest(int blAdded);
/* Has the mappings made once more, and changed: the steps are "upnp_readd1" and "upnp_readd2".
 * 0: begun; -1: there is no test daemon. */
int TAVOUPnPModifyRule(void);
/* Deletes the file of test rules. 0: it is gone; -1: it could not be deleted. */
int TAVOUpnpRemoveTestRulePath(void);
/* Sets one step of the progress file, atomically. nFlags: reserved, 0. 0: written; -1: failed. */
int TAVOUpnpReportTestProgress(const char* szStep, const char* szValue, int nFlags);
/* The server that takes reports of failed tests (platform.conf, [report]); static storage. */
const char* GetUPnPReportServer(void);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
