// SPDX-License-Identifier: Apache-2.0
/* What only the client's own files share: the trace, and the steps of an
 * exchange that follow the receive, split out so that the fuzz target can
 * drive them on bytes that never crossed a network. Not part of the
 * installed interface. */
#ifndef ISNS_INTERNAL_H
#define ISNS_INTERNAL_H

#ifdef __cplusplus
extern "C" {
#endif

/* printf to standard output, without the log prefix, while isns_trace is on. */
void _isns_tracef(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

/* n: the result of recv_response() on the response in isns_pdu_buf. Sets
 * isns_last_status; returns n when the status is 0, else -1. */
int _isns_response_status(int n);

/* r: the result of _isns_response_status(). Returns r for a well-formed
 * payload, -2 for a non-zero status, -1 otherwise (as query_entity). */
int _isns_query_result(int r);

/* r: the result of _isns_query_result(). 1, 0 or -1 as
 * isns_check_registration() for node `name`. */
int _isns_check_result(const char *name, int r);

/* n: the result of send_and_recv() for a registration. The Registration
 * Period the response carries (tag 6, 4 bytes), or 0. */
unsigned _isns_registration_period(int n);

#ifdef __cplusplus
}
#endif

#endif
