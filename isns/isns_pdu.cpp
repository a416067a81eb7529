// SPDX-License-Identifier: Apache-2.0
/* iSNSP encoder: the PDU buffer, the header and one emitter per attribute. */
#include "isns/isns_pdu.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "common/korvadm_log.h"
#include "isns/isns_internal.h"
#include "isns/isns_node.h"

unsigned char isns_pdu_buf[ISNS_PDU_SIZE];
int isns_trace = 0;
int isns_alias_on = 0;
char isns_alias[ISNS_PDU_SIZE];

void _isns_tracef(const char *fmt, ...)
{
    if (!isns_trace)
        return;
    va_list ap;
    va_start(ap, fmt);
    vprintf(fmt, ap);
    va_end(ap);
}

namespace {

size_t g_pos = ISNS_HDR_LEN; /* write position, an offset into isns_pdu_buf */
bool g_overflow = false;

/* Every byte goes through here: an attribute that would not fit is refused
 * whole, so a truncated message can never be sent. */
bool reserve(size_t n)
{
    if (g_overflow)
        return false;
    if (n > ISNS_PDU_SIZE - g_pos) {
        g_overflow = true;
        DBG(0, "iSNS message exceeds %d bytes, not sent", ISNS_PDU_SIZE);
        return false;
    }
    return true;
}

void put_u32(uint32_t v)
{
    unsigned char *p = isns_pdu_buf + g_pos;
    p[0] = static_cast<unsigned char>(v >> 24);
    p[1] = static_cast<unsigned char>(v >> 16);
    p[2] = static_cast<unsigned char>(v >> 8);
    p[3] = static_cast<unsigned char>(v);
    g_pos += 4;
}

/* Tag and length words carry only their low byte. */
void put_tl(int tag, size_t len)
{
    put_u32(static_cast<unsigned char>(tag));
    put_u32(static_cast<unsigned char>(len));
}

void put_u32_attr(int tag, uint32_t v)
{
    if (!reserve(12))
        return;
    put_tl(tag, 4);
    put_u32(v);
}

void put_string_attr(int tag, const char *text)
{
    const size_t n = std::strlen(text) + 1;
    const size_t padded = (n + 3) & ~size_t{3};
    if (!reserve(8 + padded))
        return;
    put_tl(tag, padded);
    std::memcpy(isns_pdu_buf + g_pos, text, n);
    std::memset(isns_pdu_buf + g_pos + n, 0, padded - n);
    g_pos += padded;
}

void put_empty_attr(int tag)
{
    if (reserve(8))
        put_tl(tag, 0);
}

}  // namespace

size_t isns_pdu_len(void)
{
    return g_pos;
}

int isns_pdu_overflowed(void)
{
    return g_overflow ? 1 : 0;
}

void emit_hdr(int func)
{
    _isns_tracef("   emit_hdr() func = %d\n", func);
    const unsigned char hdr[ISNS_HDR_LEN] = {
        0x00, 0x01,                                    /* version */
        0x00, static_cast<unsigned char>(func),        /* function id */
        0x00, 0x00,                                    /* PDU length, set when sent */
        0x8C, 0x00,                                    /* client, last and first PDU */
        0x00, 0x00, 0x00, 0x00,                        /* transaction, sequence */
    };
    std::memcpy(isns_pdu_buf, hdr, sizeof hdr);
    g_pos = ISNS_HDR_LEN;
    g_overflow = false;
}

void emit_attr(int tag, const char *text)
{
    _isns_tracef("Tag: %d=%s\n", tag, text ? text : "(null)");
    if (text)
        put_string_attr(tag, text);
    else
        put_empty_attr(tag);
}

void emit_delimiter(void)
{
    _isns_tracef(" 0 emit_delimiter()\n");
    put_empty_attr(ISNS_TAG_DELIMITER);
}

void emit_entity_protocol(int proto)
{
    _isns_tracef(" 2 emit_entity_protocol() proto = %d\n", proto);
    put_u32_attr(ISNS_TAG_ENTITY_PROTOCOL, static_cast<unsigned char>(proto));
}

void emit_iscsi_node_type(int type)
{
    _isns_tracef("33 emit_iscsi_node_type() type = %d\n", type);
    put_u32_attr(ISNS_TAG_ISCSI_NODE_TYPE, static_cast<unsigned char>(type));
}

void emit_null_iscsi_node_type(void)
{
    _isns_tracef("33 emit_null_iscsi_node_type()\n");
    put_empty_attr(ISNS_TAG_ISCSI_NODE_TYPE);
}

void emit_pg_iscsi_name(const char *name)
{
    _isns_tracef("48 emit_pg_iscsi_name() name = %s\n", name ? name : "(null)");
    put_string_attr(ISNS_TAG_PG_ISCSI_NAME, name ? name : "");
}

void emit_pg_tag(uint32_t tag)
{
    _isns_tracef("51 emit_pg_tag() tag = %d\n", static_cast<int>(tag));
    put_u32_attr(ISNS_TAG_PG_TAG, tag);
}

void emit_addr(int is_pg, const unsigned char *addr16)
{
    const int tag = is_pg ? ISNS_TAG_PG_PORTAL_IP_ADDR : ISNS_TAG_PORTAL_IP_ADDR;
    static const unsigned char zero[16] = {};
    if (!addr16)
        addr16 = zero;
    if (isns_trace) {
        printf("%2d emit_addr() addr = ", tag);
        for (int i = 0; i < 16; i++)
            printf("%02x ", addr16[i]);
        printf("\n");
    }
    if (!reserve(8 + 16))
        return;
    put_tl(tag, 16);
    std::memcpy(isns_pdu_buf + g_pos, addr16, 16);
    g_pos += 16;
}

void emit_port(int is_pg, uint32_t port)
{
    const int tag = is_pg ? ISNS_TAG_PG_PORTAL_PORT : ISNS_TAG_PORTAL_PORT;
    _isns_tracef("%2d emit_port() port = %u\n", tag, port);
    put_u32_attr(tag, port);
}

void emit_null_addr(void)
{
    _isns_tracef("16 emit_null_addr()\n");
    put_empty_attr(ISNS_TAG_PORTAL_IP_ADDR);
}

void emit_null_port(void)
{
    _isns_tracef("17 emit_null_port()\n");
    put_empty_attr(ISNS_TAG_PORTAL_PORT);
}

void emit_portals(const struct isns_iscsi_node *node, int is_pg)
{
    for (isns_ip_portal *p : korv::list_records<isns_ip_portal>(&node->portals)) {
        if (is_pg) {
            emit_pg_iscsi_name(node->name);
            emit_addr(1, p->address);
            emit_port(1, p->port);
            emit_pg_tag(node->pg_tag);
        } else {
            emit_addr(0, p->address);
            emit_port(0, p->port);
        }
    }
    /* Without portals a portal-group list would be empty; dropping the
     * attribute before it (the node type in registrations) is how this
     * client has always registered portal-less nodes. */
    if (is_pg && list_is_empty(&node->portals) && !g_overflow && g_pos >= ISNS_HDR_LEN + 12)
        g_pos -= 12;
}
