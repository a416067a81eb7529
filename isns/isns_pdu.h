// SPDX-License-Identifier: Apache-2.0
/* iSNSP message encoding (RFC 4171): the one PDU buffer and the emitters.
 *
 * Every request is built from scratch in one process-wide 10000-byte buffer:
 * emit_hdr() writes the 12-byte header and puts the write position at the
 * payload, each emitter appends one TLV (tag, length, value; big-endian) and
 * advances it. The transport (isns_transport.h) sends the buffer and receives
 * the response payload back into it.
 *
 * Tags and lengths are written as three zero bytes and one byte, so only
 * values up to 255 are representable; a string of 252 or more characters gets
 * a wrong length field. That is a deliberate limit of this encoder: the names
 * used are far shorter.
 *
 * The buffer never overflows: an emitter whose attribute does not fit writes
 * nothing, logs the error and marks the message as overflowed; the transport
 * refuses to send such a message. emit_hdr() clears the mark.
 *
 * Not thread-safe: one thread builds and sends one message at a time. */
#ifndef ISNS_PDU_H
#define ISNS_PDU_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ISNS_PDU_SIZE 10000 /* the PDU buffer, header included */
#define ISNS_HDR_LEN 12     /* bytes of a PDU header */

/* Function ids (RFC 4171, 6.1). */
enum isns_func {
    ISNS_DEV_ATTR_REG = 1,
    ISNS_DEV_ATTR_QRY = 2,
    ISNS_DEV_DEREG = 4,
    ISNS_DEV_ATTR_QRY_RSP = 0x8002,
};

/* Header flags (RFC 4171, 5.1.4). */
#define ISNS_FLAG_CLIENT 0x8000
#define ISNS_FLAG_LAST_PDU 0x0800
#define ISNS_FLAG_FIRST_PDU 0x0400

/* Attribute tags (RFC 4171, 6.1). */
enum isns_tag {
    ISNS_TAG_DELIMITER = 0,
    ISNS_TAG_ENTITY_ID = 1,
    ISNS_TAG_ENTITY_PROTOCOL = 2,
    ISNS_TAG_REGISTRATION_PERIOD = 6,
    ISNS_TAG_PORTAL_IP_ADDR = 16,
    ISNS_TAG_PORTAL_PORT = 17,
    ISNS_TAG_ISCSI_NAME = 32,
    ISNS_TAG_ISCSI_NODE_TYPE = 33,
    ISNS_TAG_ISCSI_ALIAS = 34,
    ISNS_TAG_PG_ISCSI_NAME = 48,
    ISNS_TAG_PG_PORTAL_IP_ADDR = 49,
    ISNS_TAG_PG_PORTAL_PORT = 50,
    ISNS_TAG_PG_TAG = 51,
};

#define ISNS_ENTITY_PROTOCOL_ISCSI 2
#define ISNS_NODE_TYPE_TARGET 1

/* The PDU buffer: request header at 0..11, payload from 12. After an
 * exchange it holds the response payload from offset 0. */
extern unsigned char isns_pdu_buf[ISNS_PDU_SIZE];

/* Non-zero turns on the emitters' and the transport's trace lines on standard
 * output (a debugging aid; nothing in the daemon sets it). Default 0. */
extern int isns_trace;

/* Non-zero makes the registrations carry isns_alias as the iSCSI Alias
 * attribute. Default 0 (no alias is sent). */
extern int isns_alias_on;
extern char isns_alias[ISNS_PDU_SIZE];

/* Bytes built so far (header included): write position - buffer start. */
size_t isns_pdu_len(void);

/* Non-zero when an emitter refused an attribute since the last emit_hdr():
 * the message is incomplete and must not be sent. */
int isns_pdu_overflowed(void);

/* Writes the request header (version 1, function id `func`, PDU length 0,
 * flags 0x8C00, transaction and sequence id 0) and sets the write position to
 * the payload. */
void emit_hdr(int func);

/* String attribute `tag`: text, NUL and zero padding to a multiple of 4;
 * NULL text gives the zero-length form (an operating attribute in queries). */
void emit_attr(int tag, const char *text);
void emit_delimiter(void);
/* The low byte of proto/type is sent. */
void emit_entity_protocol(int proto);
void emit_iscsi_node_type(int type);
void emit_null_iscsi_node_type(void);
void emit_pg_iscsi_name(const char *name);
void emit_pg_tag(uint32_t tag);
/* addr16: 16 bytes, IPv6 or IPv4-mapped. Tag 49/50 when is_pg, else 16/17. */
void emit_addr(int is_pg, const unsigned char *addr16);
void emit_port(int is_pg, uint32_t port);
void emit_null_addr(void);
void emit_null_port(void);

struct isns_iscsi_node;
/* The node's portals in list order: address and port (is_pg 0), or portal
 * groups: PG iSCSI Name, PG address, PG port, PG tag (is_pg 1). With is_pg 1
 * and no portal, the write position moves back 12 bytes, dropping the last
 * 12-byte attribute written before the call (the node type in registrations).
 * REQUIRES: node not NULL. */
void emit_portals(const struct isns_iscsi_node *node, int is_pg);

#ifdef __cplusplus
}
#endif

#endif
