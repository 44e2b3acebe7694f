/*
 * The UPnP compatibility test: operations that make and unmake test mappings on the gateway, and the
 * report of their progress. The mappings are of TCP ports that nobody has, neither a rule (while upnpd
 * is switched on) nor another host nor a program of the box, and carry a description of their own; other mappings are
 * never touched. The work is done by upnpd in its test mode ("/usr/tavo/sbin/upnpd --debug -p"), which these calls
 * start and direct; it writes what became of each step into the progress file, "finished" or "failed". When a step
 * fails, here or there, it takes its mappings away and ends; so it does by SIGHUP, within ten seconds, and when nobody
 * directs it for three minutes. What happened stands in the router log.
 */
#ifndef TAVO_UPNPTEST_H
#define TAVO_UPNPTEST_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* Has test mappings made, nRules (1000 at most) or as many as the router keeps; the step is "upnp_add", and
 * failed when it keeps none or does not answer. First takes away what a killed test has left. 0: the work has
 * begun; -1: it could not, or a test runs. */
int TAVOUPnPAddTest(int nRules);
/* How many mappings the router holds for the box, read back from its table entry by entry: the number asked
 * for when it keeps them all, else its limit, which is what it keeps of the test's and has of the rules'. At
 * least 0; -1: it could not be read. */
int TAVOUPnPCountMaxRule(void);
/* Has all test mappings taken away; the step is "upnp_delete", failed when the router still shows one, or
 * "upnp_terminal" where that one is reported as being worked on: then the test daemon ends as well. 0: begun;
 * -1: there is no test daemon. */
int TAVOUPnPDeletetest(void);
/* Prepares the connection test: a limit in seconds for reading the table, and nFlags (reserved, 0). 0: ready;
 * -1: not. */
int TAVOUPnPSetupTest(int nLimitSeconds, int nFlags);
/* Whether the test ports are open from outside (blAdded 1), or closed (0), as they should be. Some of them are
 * looked at by the port checker; without one that can tell, the router's own table is the judge, and the router
 * log says so. 0: as they should be; -1: not so. */
int TAVOUPnPPortTest(int blAdded);
/* Has the mappings made once more, and some changed to lead to another port of the box, as upnpd changes those
 * of rules: the steps are "upnp_readd1" and "upnp_readd2". 0: begun; -1: there is no test daemon. */
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
