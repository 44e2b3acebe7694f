/* The event log, for what the user must see, and the router log. */
#ifndef TAVO_LOG_H
#define TAVO_LOG_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

enum { /* events of TAVOLogSet1 */
       TAVO_EVENT_PF_ADD_FAILED = 0x13100020,
       TAVO_EVENT_PF_CONFLICT = 0x13100022,
       /* what changed behind the box's back, as the daemons tell it */
       TAVO_EVENT_PF_PORT_LOST = 0x13100030,
       TAVO_EVENT_PF_PORT_REFUSED = 0x13100031,
       TAVO_EVENT_PF_PORT_BACK = 0x13100032,
       TAVO_EVENT_PF_ROUTER_GONE = 0x13100033,
       TAVO_EVENT_PF_ROUTER_BACK = 0x13100034,
       TAVO_EVENT_PF_ROUTER_REPLACED = 0x13100035,
       TAVO_EVENT_PF_ADDRESS_CHANGED = 0x13100036,
       TAVO_EVENT_PF_RENEWED = 0x13100037
};

/* Appends one event to /var/log/tavo/event.log: time, level (1 information, 2 warning, 3 error), event
 * number and the message of the catalogue with the texts in it; control characters are made harmless.
 * nKind 1: system events, the only kind. 0: written; -1: failed. */
int TAVOLogSet1(int nKind, int nLevel, unsigned nEvent, const char* szText1, const char* szText2, const char* szText3,
                const char* szText4);

/* Appends one line to the router log, /var/log/router.log: time and text, control characters made
 * harmless. nKind 1: the router log, the only kind; nLevel: 1 information. 0: written; -1: failed. */
int TAVOWriteLog(const char* szText, int nKind, int nLevel);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
