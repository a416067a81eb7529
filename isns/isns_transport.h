// SPDX-License-Identifier: Apache-2.0
/* iSNS transport: one request, one TCP connection to the server on port 3205.
 *
 * send_and_recv() connects (non-blocking, with a select time-out), sends the
 * PDU built in isns_pdu_buf, reads the whole response (every PDU up to the one
 * with the last-PDU flag) back into isns_pdu_buf, closes the connection and
 * checks the iSNSP status.
 *
 * Time limits: the connect waits 3 s (IPv4, global IPv6) or 1 s per scope
 * (link-local IPv6, scopes bond0 when present, eth0, eth1). Receiving one
 * response ends at 1 s of silence and, whatever the server does, after
 * ISNS_RECV_DEADLINE_MS in total, so a server trickling bytes cannot hold the
 * caller.
 *
 * Responses are read into bounded buffers only: a PDU whose length would run
 * past the 10000-byte buffer fails the exchange.
 *
 * Trace output (isns_trace) goes to standard output without the log prefix.
 * With the trace off the transport is silent whatever the debug level: the
 * callers report what a failed exchange means. */
#ifndef ISNS_TRANSPORT_H
#define ISNS_TRANSPORT_H

#include <sys/socket.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ISNS_SERVER_PORT 3205
#define ISNS_RECV_DEADLINE_MS 5000 /* whole receive phase of one response */
#define ISNS_SILENCE_MS 1000       /* silence that ends a receive */

/* The server, as resolved by the daemon: numeric address text (as inet_ntop
 * prints it, "" until set) and its family, AF_INET (default) or AF_INET6. A
 * text that does not parse for the family makes every connect fail. */
extern char isns_server_addr[256];
extern int isns_addr_family;

/* iSNSP status of the last response (0 before each request). A non-zero
 * status fails send_and_recv() but stays readable here. */
extern int isns_last_status;

/* Header of the last response PDU received. */
extern unsigned char isns_rsp_hdr[12];

/* Select time-out in seconds of a pending connect; isns_connect() sets it. */
extern int isns_connect_timeout;

/* Sends isns_pdu_buf (its PDU length field is set here) to the server and
 * receives the response. Returns the payload bytes received (>= 4, the status
 * first) when the status is 0; -1 on any failure (no connection, an
 * overflowed message, a short, oversized or late response, a non-zero
 * status). */
int send_and_recv(void);

/* Connects a TCP socket to address:port (port < 1: 3205). On success returns
 * 0 with a connected blocking socket in *fd; on failure -1, no descriptor
 * left open. Link-local IPv6 addresses (fe80::/10) are tried with the scopes
 * bond0 (only if that interface exists), eth0, eth1 in that order. */
int isns_connect(int *fd, int family, const char *address, int port);

/* connect() on a non-blocking socket, waiting isns_connect_timeout seconds
 * for completion. 0 when connected, else -1. */
int connect_non_block(int fd, const struct sockaddr *addr, socklen_t len);

/* Reads one whole response: PDU headers into isns_rsp_hdr, payloads joined at
 * the start of isns_pdu_buf, until the last-PDU flag. Returns the payload
 * bytes, or 0 on failure (silence, early close, deadline, too long). */
int recv_response(int fd);

/* Reads up to 12 header bytes into isns_rsp_hdr; returns the bytes read. */
int recv_pdu_header(int fd);

/* Reads up to len bytes into dest; returns the bytes read. */
int recv_payload(int fd, unsigned char *dest, int len);

#ifdef __cplusplus
}
#endif

#endif
