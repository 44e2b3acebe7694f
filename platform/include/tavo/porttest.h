/*
 * The port connection tester: whether forwarded ports can be reached from outside. A port checker outside
 * (platform.conf, [portcheck]) connects to the router's ports; the tester looks who on the box is there to be
 * reached, and whether what the checker did came to this box.
 */
#ifndef TAVO_PORTTEST_H
#define TAVO_PORTTEST_H

#include "tavo/portforward.h"

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

enum { /* verdicts of one rule: of its ports the one that comes first in the order 4, 3, 5, 1, 2 */
       TAVO_PORT_DISABLED = 0,
       TAVO_PORT_UNKNOWN = 1, /* it could not be judged; also when the checker is missing, fails or talks nonsense */
       TAVO_PORT_OPEN = 2,    /* reached from outside, every port of it */
       TAVO_PORT_REFUSED = 3, /* refused, or another host answers in the box's place */
       TAVO_PORT_TIMEOUT = 4, /* no answer */
       TAVO_PORT_NOLISTEN = 5 /* nobody on the box listens there, so that it was not tried */
};

typedef struct tag_TAVO_PORT_STATUS {
    char szText[1024]; /* why, with the ports: "5001/tcp: connection refused"; logged for each rule, too */
    int enStatus;
} TAVO_PORT_STATUS;

/* Makes the tester ready and leaves the marker /tmp/pfStatusRule, in place of whatever another user may have
 * put there. 0: ready; negative: failed. */
int TavoPortConnTestInit(void);
/* Tests every rule of the list (null: none) and fills the first nRules entries, in rule order; entries beyond the
 * list are unknown. nFlags: 1. Takes 31 seconds at most, and a few when all goes well. A program that listens
 * on a tested TCP port sees a connection or two that say nothing. 0: done; negative: bad input or no
 * memory, entries untouched. */
int TavoPortConnTest(const TAVO_PF_CONF* pRules, int nFlags, TAVO_PORT_STATUS* rgStatus, int nRules);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
