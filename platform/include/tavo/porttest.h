/* The port connection tester: whether forwarded ports can be reached from outside. */
#ifndef TAVO_PORTTEST_H
#define TAVO_PORTTEST_H

#include "tavo/portforward.h"

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

enum { /* verdicts of one rule */
       TAVO_PORT_DISABLED = 0,
       TAVO_PORT_UNKNOWN = 1, /* it could not be judged */
       TAVO_PORT_OPEN = 2,
       TAVO_PORT_REFUSED = 3,
       TAVO_PORT_TIMEOUT = 4,
       TAVO_PORT_NOLISTEN = 5 /* nobody on the box listens there */
};

typedef struct tag_TAVO_PORT_STATUS {
    char szText[1024]; /* why, for a user */
    int enStatus;
} TAVO_PORT_STATUS;

/* Makes the tester ready and leaves the marker /tmp/pfStatusRule. 0: ready; negative: failed. */
int TavoPortConnTestInit(void);
/* Tests every rule of the list (null: none) and fills the first nRules entries, in rule order.
 * nFlags: 1. 0: done; negative: the test could not be made, entries untouched. */
int TavoPortConnTest(const TAVO_PF_CONF* pRules, int nFlags, TAVO_PORT_STATUS* rgStatus, int nRules);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
