/*
 * The run keys of the two daemons, kept through an operation that switches them.
 *
 * "runupnpportmapping" and "runnatpmpportmapping" in /etc/tavoinfo.conf say whether upnpd and natpmpd may
 * map. Saving and detection switch them off on their way; one that fails or is killed leaves them so, and
 * the next start of a daemon takes every port away. Whoever starts such an operation therefore notes the
 * keys in /var/lib/tavo/run_keys.conf first, with its own process and the state of rule.conf and
 * router.conf. What it then does to the keys through TLIBCFileSetKeyValue() is noted there as its own; keys
 * that anybody else writes afterwards stand; who has changed something else in the file, and left both off, has not
 * written them. A record that is no plain file of root's, or that holds anything
 * else, is as good as none.
 */
#ifndef TAVO_RUNKEYS_H
#define TAVO_RUNKEYS_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* Notes the keys as they are, durably, for the calling process, which holds the router's lock. What a
 * dead process noted is mended first. 0: noted; 1: another living process has a record; -1: the record
 * cannot be written, or what a dead process left cannot be mended (a full disk, mostly). */
int TAVORunKeysRemember(void);

/* After an operation that came to nothing, with the router's lock held: puts the keys that this process
 * noted back where neither file has changed since, nor the keys by somebody else. Where the rules were written
 * but no key was switched on any more, the key of the router's settings is. A daemon whose key became "yes" is
 * told (SIGHUP). 0: done and forgotten, or there was no record of this process; -1: the keys cannot be written;
 * the record stays. */
int TAVORunKeysRestore(void);

/* After an operation that did what it should: forgets this process's record. 0: gone; -1: it is still there. */
int TAVORunKeysForget(void);

/* Restores what a process that is dead had noted. Takes the router's lock for it. 0: nothing is left to
 * mend; 1: not now, since the lock is held or the process that noted is alive; -1: the keys cannot be written. */
int TAVORunKeysMend(void);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
