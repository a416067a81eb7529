// SPDX-License-Identifier: Apache-2.0
// The session listing: the kernel's sessions text of a portal group, read
// from configfs and parsed line by line into session and connection records.
//
// The text (one block per initiator; stock kernels give the same block per
// ACL in acls/<initiator>/info):
//
//   InitiatorName: iqn.2026-01.test:init1
//   LIO Session ID: 3   ISID: 0x80 28 09 49 00 00  TSIH: 3  SessionType: Normal
//   CID: 0  Connection State: TARG_CONN_STATE_LOGGED_IN
//      Address 127.0.0.1 TCP  StatSN: 0xf62d9e7c
//
// It is written by the kernel from what initiators send, so every read here
// stays inside the buffer and every copy inside its field.
#include "kernel/korvadm_mod_lio4_internal.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <limits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <system_error>
#include <type_traits>
#include <vector>

#include "common/korvadm_err.h"
#include "common/korvadm_str.h"
#include "kernel/korvadm_sess.h"

namespace {

constexpr size_t SESSIONS_BUF_SIZE = 32768;
constexpr size_t SESSION_LINE_MAX = 300;
constexpr size_t INITIATOR_NAME_MAX = 222;
constexpr size_t ADDRESS_SIZE = 32;

// Key tokens, by precedence: the first found anywhere in a line wins.
enum token { TOK_NONE = 0, TOK_INITIATOR = 1, TOK_SID = 2, TOK_CID = 3, TOK_ADDRESS = 4 };
constexpr std::string_view KEY_INITIATOR = "InitiatorName: ";
constexpr std::string_view KEY_SID = "LIO Session ID: ";
constexpr std::string_view KEY_ISID = "ISID: ";
constexpr std::string_view KEY_TSIH = "TSIH: ";
constexpr std::string_view KEY_CID = "CID: ";
constexpr std::string_view KEY_ADDRESS = "Address ";
constexpr std::string_view KEYS[] = {KEY_INITIATOR, KEY_SID, KEY_CID, KEY_ADDRESS};

int classify(std::string_view line)
{
    for (size_t i = 0; i < std::size(KEYS); ++i)
        if (line.find(KEYS[i]) != std::string_view::npos)
            return static_cast<int>(i) + 1;
    return TOK_NONE;
}

// The text after key in line; false when key is absent.
bool after(std::string_view line, std::string_view key, std::string_view &rest)
{
    size_t at = line.find(key);
    if (at == std::string_view::npos)
        return false;
    rest = line.substr(at + key.size());
    return true;
}

bool is_blank(char c)
{
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

// Reads a number as strtol does (leading blanks, a sign, "0x" in base 16)
// and moves text past it. False, text unchanged, when there is no digit or
// the value does not fit T.
template <class T>
bool read_number(std::string_view &text, int base, T &out)
{
    std::string_view t = text;
    while (!t.empty() && is_blank(t.front()))
        t.remove_prefix(1);
    bool negative = false;
    if (!t.empty() && (t.front() == '+' || t.front() == '-')) {
        negative = t.front() == '-';
        t.remove_prefix(1);
    }
    if (base == 16 && t.size() > 2 && t[0] == '0' && (t[1] == 'x' || t[1] == 'X') &&
        std::isxdigit(static_cast<unsigned char>(t[2])))
        t.remove_prefix(2);
    unsigned long long magnitude = 0;
    auto [end, ec] = std::from_chars(t.data(), t.data() + t.size(), magnitude, base);
    if (ec != std::errc() || end == t.data())
        return false;
    if (negative) {
        if constexpr (std::is_signed_v<T>) {
            if (magnitude > static_cast<unsigned long long>(std::numeric_limits<T>::max()) + 1)
                return false;
            out = static_cast<T>(-static_cast<long long>(magnitude - 1) - 1);
        } else {
            return false;
        }
    } else {
        if (magnitude > static_cast<unsigned long long>(std::numeric_limits<T>::max()))
            return false;
        out = static_cast<T>(magnitude);
    }
    text = t.substr(static_cast<size_t>(end - t.data()));
    return true;
}

// The working state of one parse (the state machine's table is in
// _lio3_parse_sessions).
struct session_parser {
    enum { OUTSIDE = 0, INITIATOR = 1, SESSION = 2 };

    list_t *sess_list;
    list_t *initiators;
    iscsi_target_t *target;
    int state = OUTSIDE;
    iscsi_initiator_t *initiator = nullptr;
    iscsi_sess_t *sess = nullptr;
    bool sess_is_new = false;  // made by this parse for the current block
    int cid = -1;
    char address[ADDRESS_SIZE] = {};

    // Links the session into its target's and initiator's lists (once, a
    // session met again is already there) and leaves the block.
    void close_session()
    {
        if (sess) {
            if (sess->target && !sess->target_node.list)
                list_append(&sess->target_node, &sess->target->sess_list);
            if (sess->initiator && !sess->initiator_node.list)
                list_append(&sess->initiator_node, &sess->initiator->sess_list);
        }
        sess = nullptr;
        cid = -1;
        state = OUTSIDE;
    }

    // Drops the block's session; one listed before this block is kept.
    void drop_session()
    {
        if (sess && sess_is_new)
            iscsi_sess_free(sess);
        sess = nullptr;
    }

    void take_initiator(std::string_view line)
    {
        std::string_view name;
        after(line, KEY_INITIATOR, name);
        char copy[INITIATOR_NAME_MAX + 1];
        korv::copy_bounded(copy, name.data());  // the rest of a terminated line
        DBG(1, "get initiator name = |%s|", copy);
        initiator = iscsi_initiator_list_search(initiators, copy);
        if (!initiator)
            initiator = iscsi_initiator_list_add(initiators, copy);
        if (!initiator)
            DBG(0, "get %s from initiator list failed", copy);
    }

    void open_session(const char *line)
    {
        if (!initiator)
            return;
        uint64_t sid = 0;
        int32_t tsih = -1;
        uint8_t isid[ISCSI_ISID_LEN] = {};
        if (_parse_LIO3_SID_line(line, &sid, &tsih, isid) != 0) {
            DBG(0, "parse SID line failed");
            return;
        }
        sess_is_new = !iscsi_sess_list_search(sess_list, sid, target, initiator);
        sess = iscsi_sess_list_add(sess_list, sid, isid, tsih, target, initiator);
        if (!sess)
            DBG(0, "add iscsi_sess_t to list failed");
    }

    void take_cid(const char *line)
    {
        if (!sess)
            return;
        if (cid != -1)
            DBG(0, "address missed, before line :|%s|", line);
        if (_parse_LIO3_sess_CID_line(line, &cid) != 0) {
            DBG(0, "parse CID line failed");
            cid = -1;
        }
        DBG(1, "get CID = |%d| ", cid);
        std::memset(address, 0, sizeof address);
    }

    // True when a connection was added.
    bool take_address(const char *line)
    {
        std::memset(address, 0, sizeof address);
        if (_parse_LIO3_sess_ADDR_line(line, address) != 0) {
            DBG(0, "parse address line failed");
            cid = -1;
        }
        DBG(1, "get ip address = %s", address);
        if (!iscsi_conn_list_add(&sess->conn_list, cid, "", address, initiator ? initiator->name : ""))
            DBG(0, "add iscsi_conn_t to list failed");
        cid = -1;
        std::memset(address, 0, sizeof address);
        return true;
    }

    // Handles one line; false when the same line must be handled again.
    bool handle(const char *line, bool &added_conn)
    {
        std::string_view text(line);
        switch (classify(text)) {
        case TOK_NONE:
            return true;
        case TOK_INITIATOR:
            if (state == SESSION) {
                close_session();
                return false;
            }
            if (state == INITIATOR) {
                DBG(0, "get initiator name = %s , in wrong state = %d", line, state);
                drop_session();
                state = OUTSIDE;
                return false;
            }
            take_initiator(text);
            state = INITIATOR;
            return true;
        case TOK_SID:
            if (state != INITIATOR) {
                DBG(0, "get SID line , in wrong state = %d", state);
                drop_session();
                state = OUTSIDE;
                return true;
            }
            open_session(line);
            state = SESSION;
            return true;
        case TOK_CID:
            if (state != SESSION)
                DBG(0, "get CID line , in wrong state = %d", state);
            else
                take_cid(line);
            return true;
        case TOK_ADDRESS:
            if (state != SESSION)
                DBG(0, "get CID line , in wrong state = %d", state);
            else if (sess && cid != -1)
                added_conn = take_address(line);
            else if (sess)
                DBG(0, "CID missed at line: |%s|", line);
            // With no session open the line is consumed all the same, so
            // the parse always moves on.
            return true;
        }
        return true;
    }
};

}  // namespace

size_t _lio3_get_session_line(char *line_out, size_t max, const char *pos, const char *end, const char **next_out)
{
    if (!line_out || !pos || !end || !next_out)
        return 0;
    *next_out = nullptr;
    line_out[0] = '\0';
    if (pos >= end)
        return 0;
    const auto *nl = static_cast<const char *>(std::memchr(pos, '\n', static_cast<size_t>(end - pos)));
    if (!nl)
        return 0;
    size_t len = std::min(static_cast<size_t>(nl - pos), max);
    std::memcpy(line_out, pos, len);
    line_out[len] = '\0';
    DBG(2, "get line len = %u", static_cast<unsigned>(len));
    *next_out = nl + 1;
    return len;
}

int _parse_LIO3_SID_line(const char *line, uint64_t *sid, int32_t *tsih, uint8_t isid[6])
{
    PARAM_GUARD(!line || !sid || !tsih || !isid, "ERR_PARAM_ERROR");
    std::string_view text(line), rest;
    if (!after(text, KEY_SID, rest) || !read_number(rest, 10, *sid)) {
        DBG(0, "get sid failed, exit");
        return -1;
    }
    DBG(2, "get sid=%llu", static_cast<unsigned long long>(*sid));
    if (after(text, KEY_ISID, rest)) {
        long value = 0;
        for (int i = 0; i < ISCSI_ISID_LEN; ++i) {
            if (!read_number(rest, 16, value))
                DBG(0, "get ISID[%d] failed", i);
            isid[i] = static_cast<uint8_t>(value);
            DBG(2, "get ISID[%d]=%x", i, isid[i]);
        }
    } else {
        DBG(0, "get ISID failed");
    }
    if (!after(text, KEY_TSIH, rest) || !read_number(rest, 10, *tsih)) {
        DBG(0, "get TSIH failed");
        *tsih = -1;
    }
    DBG(2, "get TSIH=%d", *tsih);
    return 0;
}

int _parse_LIO3_sess_CID_line(const char *line, int *cid)
{
    PARAM_GUARD(!line || !cid, "ERR_PARAM_ERROR");
    std::string_view rest;
    if (!after(line, KEY_CID, rest) || !read_number(rest, 10, *cid)) {
        DBG(0, "get CID failed");
        *cid = -1;
        return -1;
    }
    DBG(2, "get CID=%d", *cid);
    return 0;
}

int _parse_LIO3_sess_ADDR_line(const char *line, char out[32])
{
    PARAM_GUARD(!line || !out, "ERR_PARAM_ERROR");
    std::string_view rest;
    if (!after(line, KEY_ADDRESS, rest)) {
        DBG(0, "get Address failed");
        return -1;
    }
    size_t n = std::min({rest.find(' '), rest.size(), ADDRESS_SIZE - 1});
    rest.copy(out, n);
    out[n] = '\0';
    DBG(2, "get Address = %s ", out);
    return 0;
}

int _lio3_parse_sessions(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target, const char *buf,
                         size_t len)
{
    PARAM_GUARD(!sess_list || !initiator_list || !target || !buf, "ERR_PARAM_ERROR");
    if (len == 0)
        return KORV_OK;
    const char *end = buf + len;
    char line[SESSION_LINE_MAX + 1];
    const char *pos = buf, *next = nullptr;
    size_t n = _lio3_get_session_line(line, SESSION_LINE_MAX, pos, end, &next);
    session_parser p{sess_list, initiator_list, target};
    while (n > 0 && pos < end) {
        DBG(2, "parsing line : |%s|", line);
        bool added_conn = false;
        if (!p.handle(line, added_conn))
            continue;
        pos = next;
        n = _lio3_get_session_line(line, SESSION_LINE_MAX, pos, end, &next);
        // A block's last connection closes it when the text ends there.
        if (added_conn && n == 0)
            p.close_session();
    }
    // A session still open stays listed, but is not linked to its target
    // and initiator.
    return KORV_OK;
}

/* ------------------------------------------------------------- the reader */

namespace {

// Stock kernels: the ACLs' "info" texts with a session, one after another,
// cut when the buffer is full. An idle ACL's text ("No active iSCSI Session
// for Initiator Endpoint: ...") is left out: between a session's last
// address and the next initiator it would keep that session from closing.
// -9973 when one that exists cannot be read.
int read_acl_infos(const std::string &acls, const std::vector<std::string> &names, char *buf, size_t &used)
{
    used = 0;
    for (const std::string &name : names) {
        if (used >= SESSIONS_BUF_SIZE)
            break;
        std::string info = acls + "/" + name + "/info";
        if (configfs_path_exist(info.c_str()) != 0)
            continue;  // an ACL that went away meanwhile
        size_t n = 0;
        if (configfs_read_attr_buf(info.c_str(), buf + used, SESSIONS_BUF_SIZE - used, &n) != 0) {
            DBG_AS("lio3_get_target_session", 0, "read path %s failed", info.c_str());
            return ERR_CONFIGFS;
        }
        if (std::string_view(buf + used, n).find(KEY_INITIATOR) == std::string_view::npos)
            continue;
        used += n;
        // Keep the next text's first line a line of its own.
        if (n > 0 && buf[used - 1] != '\n' && used < SESSIONS_BUF_SIZE)
            buf[used++] = '\n';
    }
    return KORV_OK;
}

}  // namespace

int lio3_get_target_session(list_t *sess_list, list_t *initiator_list, iscsi_target_t *target)
{
    PARAM_GUARD(!sess_list || !initiator_list, "ERR_PARAM_ERROR");
    CHECK_TARGET(target, "ERR_PARAM_ERROR", "target iqn is empty", "target tpgt is wrong: %d", target->tpgt);
    std::string tpg = lio4::tpg_dir(target->iqn, target->tpgt);
    std::string sessions = tpg + "/sessions";
    std::string acls = tpg + "/acls";
    bool have_sessions = configfs_path_exist(sessions.c_str()) == 0;
    std::vector<std::string> names;
    if (!have_sessions && !lio4::list_subdirs(acls, names)) {
        DBG(2, "session path do not exist, path = %s", sessions.c_str());
        return KORV_OK;
    }
    std::sort(names.begin(), names.end());
    korv::c_buffer buf(static_cast<char *>(std::calloc(1, SESSIONS_BUF_SIZE)));
    if (!buf) {
        DBG(0, "malloc size = %d failed", static_cast<int>(SESSIONS_BUF_SIZE));
        return ERR_NO_MEMORY;
    }
    size_t len = 0;
    if (have_sessions) {
        if (configfs_read_attr_buf(sessions.c_str(), buf.get(), SESSIONS_BUF_SIZE, &len) != 0) {
            DBG(0, "read path %s failed", sessions.c_str());
            return ERR_CONFIGFS;
        }
    } else if (int rc = read_acl_infos(acls, names, buf.get(), len); rc != 0) {
        return rc;
    }
    if (_lio3_parse_sessions(sess_list, initiator_list, target, buf.get(), len) != 0) {
        DBG(0, "parse session failed");
        return ERR_CONFIGFS;
    }
    return KORV_OK;
}
