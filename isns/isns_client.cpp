// SPDX-License-Identifier: Apache-2.0
/* iSNS operations: registration, deregistration and the registration check. */
#include "isns/isns_client.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "isns/isns_internal.h"
#include "isns/isns_pdu.h"
#include "isns/isns_transport.h"

char isns_entity_id[128];
char isns_entity_name[256];
uint32_t isns_registration_period;

namespace {

/* Registration options: bit 0 sends the portal lists; the whole word goes out
 * as the iSCSI Node Type, so it must stay 1 (Target). */
int g_reg_options = 0;

uint32_t be32(const unsigned char *p)
{
    return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
           (static_cast<uint32_t>(p[2]) << 8) | p[3];
}

/* One attribute of a received payload; value lies within the payload. */
struct attr {
    uint32_t tag;
    uint32_t len;
    const unsigned char *value;
};

/* Walks the attributes of payload[from, size). Returns false, having visited
 * only whole attributes, when one is cut short or has a length that is not a
 * multiple of 4. */
template <class Fn>
bool walk_attrs(const unsigned char *payload, size_t from, size_t size, Fn fn)
{
    size_t p = from;
    while (p < size) {
        if (size - p < 8)
            return false;
        const attr a{be32(payload + p), be32(payload + p + 4), payload + p + 8};
        if (a.len % 4 != 0 || a.len > size - p - 8)
            return false;
        if (!fn(a))
            return true;
        p += 8 + a.len;
    }
    return true;
}

/* Items shared by both registrations up to the key's delimiter. */
void emit_reg_head(void)
{
    emit_hdr(ISNS_DEV_ATTR_REG);
    emit_attr(ISNS_TAG_ISCSI_NAME, isns_entity_name);
    emit_attr(ISNS_TAG_ENTITY_ID, isns_entity_id);
    emit_delimiter();
    emit_attr(ISNS_TAG_ENTITY_ID, isns_entity_id);
}

/* The node, its type (and alias) and its portal groups. */
void emit_reg_node(const isns_iscsi_node *node)
{
    emit_attr(ISNS_TAG_ISCSI_NAME, node->name);
    emit_iscsi_node_type(g_reg_options);
    if (isns_alias_on)
        emit_attr(ISNS_TAG_ISCSI_ALIAS, isns_alias);
    if (g_reg_options & 1)
        emit_portals(node, 1);
}

}  // namespace

namespace {

// The entity's first registration also carries the protocol and its portals;
// further nodes only name portals the entity already has.
int register_with(isns_iscsi_node *node, bool entity)
{
    if (!node)
        return -1;
    g_reg_options = 1;
    emit_reg_head();
    if (entity) {
        emit_entity_protocol(ISNS_ENTITY_PROTOCOL_ISCSI);
        if (g_reg_options & 1)
            emit_portals(node, 0);
    }
    emit_reg_node(node);
    const int r = send_and_recv();
    if (entity)
        isns_registration_period = _isns_registration_period(r);
    return r < 0 ? r : 0;
}

}  // namespace

int register_entity(isns_iscsi_node *node)
{
    return register_with(node, true);
}

int register_node(isns_iscsi_node *node)
{
    return register_with(node, false);
}

int deregister_entity(const char *name)
{
    _isns_tracef("deregister_entity()\n");
    emit_hdr(ISNS_DEV_DEREG);
    emit_attr(ISNS_TAG_ISCSI_NAME, name ? name : "");
    emit_delimiter();
    emit_attr(ISNS_TAG_ENTITY_ID, isns_entity_id);
    return send_and_recv() < 0 ? -1 : 0;
}

int query_entity(const char *name)
{
    emit_hdr(ISNS_DEV_ATTR_QRY);
    emit_attr(ISNS_TAG_ISCSI_NAME, isns_entity_name);
    emit_attr(ISNS_TAG_ISCSI_NAME, name ? name : "");
    emit_iscsi_node_type(ISNS_NODE_TYPE_TARGET);
    emit_delimiter();
    emit_attr(ISNS_TAG_ISCSI_NAME, nullptr);
    return _isns_query_result(send_and_recv());
}

unsigned _isns_registration_period(int n)
{
    uint32_t period = 0;
    if (n >= 4)
        walk_attrs(isns_pdu_buf, 4, static_cast<size_t>(n), [&](const attr &a) {
            if (a.tag == ISNS_TAG_REGISTRATION_PERIOD && a.len == 4)
                period = be32(a.value);
            return period == 0;
        });
    return period;
}

int _isns_query_result(int r)
{
    if (r < 0)
        return isns_last_status != 0 ? -2 : -1;
    if (!walk_attrs(isns_pdu_buf, 4, static_cast<size_t>(r), [](const attr &) { return true; })) {
        DBG(1, "malformed iSNS query response (%d bytes)", r);
        return -1;
    }
    return r;
}

int isns_check_registration(const char *name)
{
    if (!name)
        return -1;
    return _isns_check_result(name, query_entity(name));
}

int _isns_check_result(const char *name, int r)
{
    if (!name)
        return -1;
    if (r < 0) {
        if (r == -2 && (isns_last_status == 6 || isns_last_status == 7))
            return 0;
        return -1;
    }
    if (((isns_rsp_hdr[2] << 8) | isns_rsp_hdr[3]) != ISNS_DEV_ATTR_QRY_RSP || r == 0)
        return 0;

    /* Attributes up to the first delimiter echo our key; the names the
     * server holds follow it. */
    const std::string_view want(name);
    bool after_delim = false;
    bool matched = false;
    walk_attrs(isns_pdu_buf, 4, static_cast<size_t>(r), [&](const attr &a) {
        if (!after_delim) {
            after_delim = a.tag == ISNS_TAG_DELIMITER;
            return true;
        }
        if (a.tag == ISNS_TAG_ISCSI_NAME && a.len > 3) {
            const char *v = reinterpret_cast<const char *>(a.value);
            const std::string_view got(v, strnlen(v, a.len));
            if (got == want) {
                _isns_tracef("iscsi name matched.\n");
                matched = true;
                return false;
            }
            _isns_tracef("get iSCSI name = %.*s , length = %d\n", static_cast<int>(got.size()), got.data(),
                         static_cast<int>(a.len));
        } else {
            _isns_tracef("get tag = %02x%02x%02x%02x , length = %d\n", a.tag >> 24, (a.tag >> 16) & 0xff,
                         (a.tag >> 8) & 0xff, a.tag & 0xff, static_cast<int>(a.len));
        }
        return true;
    });
    return matched ? 1 : 0;
}
