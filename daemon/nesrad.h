// SPDX-License-Identifier: Apache-2.0
/* nesrad, the iSNS client daemon: start-up, the main loop, the list of nodes
 * it registers, and the registration of the configured targets.
 *
 * One thread. The daemon reads the targets from the configuration store at
 * every pass of its loop, learns each target's portals from the kernel
 * driver, registers the first target as the entity and the rest as further
 * nodes of it, then checks once an interval that the server still holds the
 * first node. SIGUSR1/SIGUSR2 mean "the configuration changed: deregister,
 * read again, register again"; SIGTERM (or SIGINT) deregisters and exits.
 * One daemon runs per system root ("/var/run/nesrad.lock"). All protocol
 * state (server address, entity identifier, entity name) lives in isns/. */
#ifndef DAEMON_NESRAD_H
#define DAEMON_NESRAD_H

#include "config/korvadm_conf.h"
#include "isns/isns_client.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Seconds between two checks of the server in the installed daemon. */
#define NESRAD_POLL_INTERVAL 60u

/* The configuration context, filled once at start-up by iscsi_conf_init;
 * the node list reads the targets through its table. */
extern iscsi_conf_ctx_t g_nesrad_conf;

/* ---- registered node list ---- */

/* One configured target to register; owned by the daemon's node list. */
typedef struct nesrad_node_s {
    char iqn[256];              /* the target's IQN, at most 255 characters */
    int tpgt;                   /* its portal group tag */
    struct nesrad_node_s *next; /* NULL at the tail */
} nesrad_node_t;

/* Lower-cases A-Z and turns '_' into '-' in place (the entity identifier's
 * form of the host name). 0, or -1 for NULL. */
int conv_str(char *s);

/* The node list's own operations. They are private to the daemon and
 * declared here only so that tests can reach them. Insertion order is kept
 * and duplicates are not prevented. */
void _iqn_add(const char *iqn, int tpgt);
/* Removes the first record with this IQN; an absent IQN does nothing. */
void _iqn_del(const char *iqn);
/* 0 when the IQN is listed, -1 when not or NULL. */
int _iqn_query(const char *iqn);
/* iqn NULL: *out = the head (-1 when the list is empty). Otherwise *out = the
 * successor of that IQN's record (NULL after the last one), or -1 when the
 * IQN is not listed. */
int _iqn_next(const char *iqn, nesrad_node_t **out);
/* Empties the list; 0. */
int _iqn_clear(void);

/* Refreshes the entity identifier from the host name (kept when the host
 * name cannot be read) and appends one record per configured target, its
 * IQN built from the saved prefix, the entity identifier and the target
 * name. Returns the number of targets, or -1 when the targets cannot be read
 * or an IQN cannot be built (records added before stay listed). */
int init_iqn_list(void);

/* ---- registration ---- */

/* IPv4 dotted text to the 16-byte IPv4-mapped IPv6 form (::ffff:a.b.c.d).
 * The text must hold three dots; each part is read like atoi and kept to its
 * low byte (the kernel has already checked the address). 0, or -1. */
int ipv4_text_to_bytes(unsigned char out[16], const char *text);

/* Fills an empty node with the IQN, the tag and the portals the kernel
 * driver reports for that target (IPv4 before IPv6 of the same portal).
 * 0 (also with no portal), or -1 for bad arguments or when the portals
 * cannot be listed. */
int get_iscsi_node_from_mod(isns_iscsi_node *node, const char *iqn, int tpgt);

/* Registers the entity with its first target, which then becomes the entity
 * name, the source of every later request. The server's answer is not
 * looked at (the periodic check finds failures). 0 when the node was built
 * and sent, -1 when its portals could not be listed (nothing sent). */
int target_register_entity_identifier(const char *iqn, int tpgt);

/* Registers a further target as a node of the entity; 0 or -1 as above. */
int target_register_iSNS_single(const char *iqn, int tpgt);

/* Registers every listed target, the first as the entity. 0, or -1 when the
 * list is empty (nothing sent). */
int target_register_iSNS_all(void);

/* One deregistration of the whole entity (answer ignored), then the entity
 * name is cleared. Always 0. */
int target_deregister_entity_identifier(void);

/* ---- entry ---- */

/* Milliseconds between two checks of the server: the poll interval, or two
 * thirds of the server's registration period (never below 5 s) when that
 * period is shorter than two intervals. period 0: the server gave none. */
unsigned nesrad_check_interval_ms(unsigned poll_interval, unsigned period);

/* Stores getpid() (on != 0) or 0 as the daemon's pid in the configuration
 * store; a failure is logged and returned. */
int write_pid(int on);

/* The whole daemon: start-up from argv[1] ("--help" and "--version" print and
 * return 0), then the main loop with the given number of seconds between
 * server checks. Returns the process exit status: 0 after SIGTERM or SIGINT,
 * 1 for argument, configuration or address failures and when another daemon
 * keeps the lock for 20 s, -1 (255) when the targets cannot be read (after
 * 10 s of retries when the configuration service does not answer). Call once
 * per process. */
int nesrad_main(int argc, char **argv, unsigned poll_interval);

#ifdef __cplusplus
}
#endif

#endif
