/* The one call of the device's structured event log that Pelorus makes. Where the device has
 * libqvlog, its own header and library are used and this one is not installed. */
#ifndef QVLOG_H
#define QVLOG_H

/* NOLINTBEGIN(bugprone-reserved-identifier): the names are the library's own */
/* Ends the list of key, kind and value. */
#define __QVLOG_END ((const char*)0)

#ifdef __cplusplus
extern "C" {
#endif

/* Logs one event: level, event name, then any number of (key, value kind, value), closed by
 * __QVLOG_END. The only value kind this stand-in knows is 3, a C string; a pair of another kind
 * ends the line there. */
void __qvlog_kvp(int level, const char* event, ...);
/* NOLINTEND(bugprone-reserved-identifier) */

#ifdef __cplusplus
}
#endif

#endif
