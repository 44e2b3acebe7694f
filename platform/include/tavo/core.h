/*
 * The core of the platform: sectioned and key files, string hashes and lists, the last error,
 * processes and services. Plain C types; safe to call from C11 and C++.
 *
 * Text is NUL-terminated UTF-8. Every pointer handed out by an *Alloc or *Get function that returns
 * a container belongs to the caller, who gives it back with the matching *Free; a `const char*` read
 * out of a container stays valid until the container changes. Null arguments are bad input: the
 * functions answer with their failure value, and those that can fail in more than one way record the reason as
 * the last error.
 */
#ifndef TAVO_CORE_H
#define TAVO_CORE_H

#include <sys/types.h>

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* ---- string hashes: unique keys, insertion order kept ------------------------------------------ */

typedef struct tag_TLIBC_SZHASH TLIBCSzHash;

/* A new, empty hash with room for nSize keys (it grows beyond that by itself). NULL: no memory. */
TLIBCSzHash* TLIBCSzHashAlloc(int nSize);
/* Releases the hash and all it holds. NULL is ignored. */
void TLIBCSzHashFree(TLIBCSzHash* pHash);
/* The value of szKey, or NULL when the key is absent or was stored without a value. */
const char* TLIBCSzHashGetValue(const TLIBCSzHash* pHash, const char* szKey);
/* Stores a copy of szValue (NULL: the key without a value); a known key keeps its place.
 * 1: stored; -1: null hash, null or empty key, or no memory. */
int TLIBCSzHashSetValue(TLIBCSzHash* pHash, const char* szKey, const char* szValue);
/* Number of keys; -1 for a null hash. */
int TLIBCSzHashCount(const TLIBCSzHash* pHash);
/* The pair at nIndex (0 is the oldest). 1: both outputs set (*pszValue NULL for a key without a
 * value); 0: no such index or a null argument, outputs untouched. */
int TLIBCSzHashGetAt(const TLIBCSzHash* pHash, int nIndex, const char** pszKey, const char** pszValue);

/* ---- string lists ----------------------------------------------------------------------------- */

typedef struct tag_TLIBC_SZLIST TLIBCSzList;

TLIBCSzList* TLIBCSzListAlloc(int nSize);
void TLIBCSzListFree(TLIBCSzList* pList);
/* Appends a copy. 1: appended; -1: null argument or no memory. */
int TLIBCSzListPush(TLIBCSzList* pList, const char* szItem);
/* The item at nIndex, or NULL when there is none. */
const char* TLIBCSzListGet(const TLIBCSzList* pList, int nIndex);
int TLIBCSzListCount(const TLIBCSzList* pList);

/* ---- last error, per thread ------------------------------------------------------------------- */

enum {
    TLIBC_ERR_NONE = 0x0000,
    TLIBC_ERR_BAD_PARAMETER = 0x0D00,
    TLIBC_ERR_NO_MEMORY = 0x0200,
    TLIBC_ERR_OPEN = 0x0900,
    TLIBC_ERR_READ = 0x0901,
    TLIBC_ERR_WRITE = 0x0902,
    TLIBC_ERR_RENAME = 0x0903,
    TLIBC_ERR_NOT_FOUND = 0x0700,
    TLIBC_ERR_FORMAT = 0x0A00,
    TLIBC_ERR_EXEC = 0x0B00
};

void TLIBCErrSet(int nErr, const char* szFile, int nLine);
int TLIBCErrGet(void);
const char* TLIBCErrorGetFile(void);
int TLIBCErrorGetLine(void);

/* ---- files ------------------------------------------------------------------------------------
 * Sectioned file: `[section]` on a line, `key="value"` lines below it; key file: the same without
 * sections, and fit to be sourced by a shell. In quotes `\\ \" \n \r \t \xHH` (and `\$ \`` in key
 * files) are escapes; unquoted values, blank lines and `#` comments are read. Whatever a value holds
 * survives a round trip and can never open a section or a key of its own. Every write goes to a new
 * file in the same directory, is flushed, keeps owner and mode and is renamed over the old one; a
 * failed write leaves the old file.
 */

enum { TLIBC_MAX_FILE = 16 << 20 /* bytes of a file; more is neither read nor written */ };

/* 1: something exists at szPath; 0: nothing does (or null). The router settings that a killed report set aside are
 * put back first (see portforward.h): what it put in their place is nobody's. */
int TLIBCFileExist(const char* szPath);
/* Creates an empty file, or updates the times of one that is there. 0: done; -1: failed. */
int TLIBCFileTouch(const char* szPath);

/* Reads the pairs of one section into pHash. Number of pairs read; 0: the section is absent or empty;
 * negative: the file cannot be read or parsed. Two sections of one name are read as one; of two pairs with
 * one key the last counts. */
int TLIBCFileGetSection(const char* szPath, const char* szSection, TLIBCSzHash* pHash);
/* Writes the section at the end of the file, which is created 0600 when missing; a section of that
 * name is replaced where it stands, and further ones of that name go. nFlags: reserved, 0.
 * 1: written; negative: failed. */
int TLIBCFileAddSection(const char* szPath, const char* szSection, const TLIBCSzHash* pHash, int nFlags);
/* One value of one section, cut at nSize - 1 bytes. 0: found; negative: file, section or key missing. */
int TLIBCFileGetSectionValue(const char* szPath, const char* szSection, const char* szKey, char* szValue, int nSize);

/* One value of a key file, cut at nSize - 1 bytes. At least 1: found; negative: file or key missing,
 * szValue untouched. nFlags: reserved, 0. */
int TLIBCFileGetKeyValue(const char* szPath, const char* szKey, char* szValue, int nSize, int nFlags);
/* Sets one value of a key file; the line is written in szFormat, which takes the key and the escaped
 * value as two "%s" (NULL: "%s=\"%s\"\n"). The other lines stay as they are. 1: written; negative: failed. */
int TLIBCFileSetKeyValue(const char* szPath, const char* szKey, const char* szValue, const char* szFormat);
/* All pairs of a key file in file order into *ppHash (allocated when *ppHash is NULL); szPrefix: only
 * keys that begin with it, NULL for all; szSeparator: what stands between key and value. A line without
 * a separator is a key without a value. Number of pairs; -1: the file cannot be read. */
int TLIBCFileGetKeys(const char* szPath, const char* szPrefix, TLIBCSzHash** ppHash, const char* szSeparator);

/* ---- processes -------------------------------------------------------------------------------- */

/* 1: a non-zombie process has szName as its name (basename of argv[0], of an interpreter's script, or
 * the kernel's 15-character name) or, where szName holds a "/" or a blank, as its whole command line;
 * 0: none; -1: null or empty name, or /proc unreadable. */
int TLIBCIsProcAlive(const char* szName);
/* Sends nSignal to every process that the rule above matches, the caller excepted. Number of
 * processes signalled; -1: bad input. */
int TLIBCKill(const char* szName, int nSignal);
/* The pid in the file; -1: no file, or no number above 0 in it. */
pid_t TLIBCReadPidFile(const char* szPath);
/* Starts a program without a shell, detached from the caller (own session, no zombie left, no
 * descriptor above standard error), with up to four arguments, ended by the first NULL; returns at
 * once. One of our own daemons without arguments is started as its unit where systemd runs and has one.
 * 0: started; -1: it could not be executed, or its unit does not start. */
int TLIBCExec(const char* szPath, const char* szArg1, const char* szArg2, const char* szArg3, const char* szArg4);
/* Forks; the child keeps the caller's descriptors and handlers. The child: 0; the parent: its pid;
 * negative with errno set: no process could be made. */
pid_t TLIBCProcFork(void);
/* Runs a command through /bin/sh with no descriptor above standard error and waits. Its exit status
 * (128 + signal when it was killed; 255 when it is lost because the caller ignores SIGCHLD); -1: the shell
 * could not be started, or a null command. */
int TLIBCSystem(const char* szCommand);

/* ---- services --------------------------------------------------------------------------------- */

/* 1: running; 0: not running; -1: unknown service or bad name. */
int TLIBServiceIsRunning(const char* szName);
/* 0: done; -1: failed. */
int TLIBServiceReload(const char* szName);
int TLIBServiceRestart(const char* szName);

/* ---- the platform's own settings, /etc/tavo/platform.conf --------------------------------------- */

/* The value of szKey in [szSection], or szDefault when file, section or key is missing; cut at
 * nSize - 1 bytes. Always fills szValue. */
void TLIBPlatformSettingGet(const char* szSection, const char* szKey, const char* szDefault, char* szValue, int nSize);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
