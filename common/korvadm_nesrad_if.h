// SPDX-License-Identifier: Apache-2.0
/* The management tool's side of controlling nesrad. The tool never talks to
 * the daemon over a socket: it starts it as a background shell command,
 * stops it by name with killall, and signals configuration changes to the
 * pid the daemon stores under "/system_mgr/iscsi/iSNS/pid". Three stored
 * settings carry the contract: that pid, the iSNS enable flag and the iSNS
 * server; the iSCSI service's own enable flag decides whether the daemon may
 * run at all. */
#ifndef KORVADM_NESRAD_IF_H
#define KORVADM_NESRAD_IF_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* A malloc'd copy of text with a backslash before each $, ", \ and `, safe
 * inside a double-quoted shell word; the caller frees it. NULL for NULL text
 * or when memory is short. */
char *_insert_back_slash_strdup(const char *text);

/* Sends sig to the stored pid and sleeps 1 s so the daemon acts before the
 * tool goes on. A stored pid of 0 (or an unreadable one) sends nothing and
 * does not sleep. */
void notify_isnsclient(int sig);

/* Stops any running daemon by name, then with state 1 starts
 * `nesrad "<server>" &` through the shell. 0 success, -9989 state 1 without a
 * server (nothing is stopped), -9987 the command could not be built, -9984
 * the shell failed. */
int isns_set_ctl_module(uint32_t state, const char *server);

/* Stops the daemon when the target is loaded and iSNS is on, then deletes the
 * stored iSNS settings (not saved). 0, or -9981 when the delete failed. */
int isns_factory_reset(void);

/* Stores the iSNS enable flag and server and saves the configuration; while
 * the iSCSI service is enabled, (re)starts or stops the daemon to match,
 * leaving a running daemon alone when neither the flag nor the server
 * changes. use_stored (or a NULL server) keeps the stored server. -9989 for a
 * state other than 0/1; otherwise 0, even when a step failed (it is logged). */
int isns_set_setting(int state, const char *server, int use_stored);

#ifdef __cplusplus
}
#endif

#endif
