// SPDX-License-Identifier: Apache-2.0
// System information, storage half: where volumes are mounted, whether they
// are unlocked, how much room they have and whether their disks sleep.
//
// Descriptions come from the system-information database; mount paths read
// there are data, used as they are (never mapped through the system root).
// Output of "df" and "powermgmt" is untrusted text: it is read bounded and
// converted with checks, and a line that does not add up fails or is clamped.
#include "common/korvadm_sys_internal.h"

#include <algorithm>
#include <climits>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "platform/platform_util.h"
#include "platform/xmldbc.h"

namespace {

constexpr const char *kSock = XMLDB_SOCK_SYSINFO;
constexpr size_t kDfCmdLen = 500;       // command buffer of the df line
constexpr size_t kDfReadLen = 1000;     // bytes of df output looked at
constexpr size_t kPowerReadLen = 128;   // bytes of "powermgmt -s" output looked at
constexpr size_t kMaskDigits = 40;      // width of the mask conversion
constexpr const char *kMembersSep = " ,\t\n";

constexpr int kMounted = ID_ENTRY_FOUND;       // 5
constexpr int kNotMounted = ID_ENTRY_NOT_FOUND; // 6
constexpr int kUnlocked = 10;
constexpr int kLocked = 9;

// Reads a system-information value into buf. False when the service fails
// or the value does not fit (a cut path or UUID would name something else);
// an absent node reads "" and true.
bool sysinfo_get(const char *key, char *buf, size_t size)
{
    char scratch[1024];
    buf[0] = '\0';
    if (xmldbc_get_wb(kSock, 0, key, scratch, sizeof scratch) < 0)
        return false;
    if (std::strlen(scratch) >= size) {
        DBG(1, "value of %s too long", key);
        return false;
    }
    std::memcpy(buf, scratch, std::strlen(scratch) + 1);
    return true;
}

template <size_t N>
bool entry_get(char (&buf)[N], const char *list, const char *item, int idx, const char *field)
{
    char key[128];
    std::snprintf(key, sizeof key, "/%s/%s:%d/%s", list, item, idx, field);
    return sysinfo_get(key, buf, N);
}

template <size_t N>
bool vol_get(char (&buf)[N], int idx, const char *field)
{
    return entry_get(buf, "vols", "vol", idx, field);
}

int read_count(const char *key)
{
    char text[128];
    long long v = 0;
    if (!sysinfo_get(key, text, sizeof text) || str2ll(text, &v) != 0)
        v = 0;
    int n = static_cast<int>(std::clamp(v, 0LL, static_cast<long long>(SYSINFO_MAX_ENTRIES)));
    DBG(1, "Get strNode: %s = %d", key, n);
    return n;
}

// Calls fn(idx) for volumes 1, 2, ... until a volume's name is empty (or
// unreadable) or fn returns false.
template <class Fn>
void for_each_volume(Fn fn)
{
    for (int idx = 1; idx <= SYSINFO_MAX_ENTRIES; ++idx) {
        char name[64];
        if (!vol_get(name, idx, "name") || !name[0] || !fn(idx))
            return;
    }
}

// 1-based index of the entry whose field equals value, scanning until an
// empty field; 0 when absent.
int find_entry(const char *list, const char *item, const char *field, const char *value)
{
    for (int idx = 1; idx <= SYSINFO_MAX_ENTRIES; ++idx) {
        char text[VOL_MNT_PATH_LEN];
        if (!entry_get(text, list, item, idx, field) || !text[0])
            return 0;
        if (std::strcmp(text, value) == 0)
            return idx;
    }
    return 0;
}

// The volume's mount path into mnt when a file system is mounted there.
template <size_t N>
bool vol_mounted_path(int idx, char (&mnt)[N])
{
    return vol_get(mnt, idx, "mnt") && mnt[0] && sys_mount_point(mnt);
}

bool uuid_matches(int idx, const char *uuid)
{
    char id[VOL_UUID_LEN];
    return vol_get(id, idx, "uuid") && std::strcmp(id, uuid) == 0;
}

// Bounded text of a parsed command: at most max_len - 1 bytes, line ends
// kept. Returns the command's status, or 0 when the reading was cut short
// (the command may then die of SIGPIPE, which is not its failure).
int read_output(const char *cmd, size_t max_len, std::string &out)
{
    bool cut = false;
    int status = korv::read_command_lines(cmd, [&](std::string_view line) {
        size_t room = max_len - 1 - out.size();
        out.append(line.substr(0, room));
        if (line.size() >= room) {
            cut = true;
            return false;
        }
        out += '\n';
        return true;
    });
    return status >= 0 && cut ? 0 : status;
}

// "%40x" after "result: ", keeping the mask's low 32 bits; 0 without the
// marker or digits.
uint32_t parse_result_mask(std::string_view out)
{
    size_t at = out.find("result: ");
    if (at == std::string_view::npos)
        return 0;
    std::string_view s = out.substr(at + 8);
    while (!s.empty() && (s[0] == ' ' || s[0] == '\t' || s[0] == '\n'))
        s.remove_prefix(1);
    s = s.substr(0, kMaskDigits);
    if (s.size() > 2 && s[0] == '0' && (s[1] == 'x' || s[1] == 'X'))
        s.remove_prefix(2);
    uint32_t mask = 0;
    for (char c : s) {
        int d = c >= '0' && c <= '9' ? c - '0' : c >= 'a' && c <= 'f' ? c - 'a' + 10 : c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
        if (d < 0)
            break;
        mask = (mask << 4) | static_cast<uint32_t>(d);
    }
    return mask;
}

// An unsigned decimal at the start of field; text after the digits ("35%")
// is accepted.
bool df_number(std::string_view field, const char *what, uint64_t &value)
{
    auto [end, ec] = std::from_chars(field.data(), field.data() + field.size(), value);
    std::string text(field);
    if (ec != std::errc() || end == field.data()) {
        DBG(0, "failed to convert %s to number", text.c_str());
        return false;
    }
    DBG(2, "%s = %s, converted to %llu", what, text.c_str(), static_cast<unsigned long long>(value));
    return true;
}

std::string_view next_field(std::string_view &line)
{
    size_t b = line.find_first_not_of(" \t");
    if (b == std::string_view::npos) {
        line = {};
        return {};
    }
    line.remove_prefix(b);
    size_t e = std::min(line.find_first_of(" \t"), line.size());
    std::string_view f = line.substr(0, e);
    line.remove_prefix(e);
    return f;
}

}  // namespace

/* ---------------------------------------------------------------------------
 * Volume entries
 * ------------------------------------------------------------------------- */

vol_info_t *vol_info_new(void)
{
    vol_info_t *vol = korv::list_record_new(&vol_info_t::node);
    if (!vol)
        DBG(0, "malloc vol_info_t failed");
    return vol;
}

void vol_info_free(vol_info_t *vol)
{
    korv::list_record_free(vol, &vol_info_t::node);
}

void vol_info_free_list(list_t *list)
{
    list_release(list, [](void *rec) { vol_info_free(static_cast<vol_info_t *>(rec)); });
}

/* ---------------------------------------------------------------------------
 * The system-information database
 * ------------------------------------------------------------------------- */

int xmldb_get_disk_cnt(void) { return read_count("/disks/disk#"); }

int xmldb_get_vol_cnt(void) { return read_count("/vols/vol#"); }

int xmldb_get_md_dbidx_by_md_dev(const char *md_dev)
{
    int idx = md_dev && md_dev[0] ? find_entry("raids", "raid", "dev", md_dev) : 0;
    if (idx < 1)
        DBG(0, "can not find md device: %s", md_dev ? md_dev : "(null)");
    return idx;
}

int xmldb_get_disk_dbidx_by_name(const char *name)
{
    int idx = name && name[0] ? find_entry("disks", "disk", "name", name) : 0;
    if (idx < 1)
        DBG(1, "can not find disk device: %s", name ? name : "(null)");
    return idx;
}

int xmldb_get_md_raid_disks(int raid_idx, char *out, size_t size)
{
    PARAM_GUARD(raid_idx < 1 || !out || size == 0);
    char key[128];
    std::snprintf(key, sizeof key, "/raids/raid:%d/raid_disks", raid_idx);
    if (!sysinfo_get(key, out, size) || !out[0])
        return ERR_NOT_FOUND;
    return KORV_OK;
}

/* ---------------------------------------------------------------------------
 * Mount paths and lock state
 * ------------------------------------------------------------------------- */

int sys_raid_get_mnt_path_by_uuid(char *out, size_t size, const char *uuid)
{
    PARAM_GUARD(!out || size == 0 || !uuid);
    out[0] = '\0';
    if (!uuid[0])
        return kNotMounted;
    bool found = false;
    for_each_volume([&](int idx) {
        char mnt[VOL_MNT_PATH_LEN];
        // No stop at a match: with duplicate UUIDs the last mounted one wins.
        if (uuid_matches(idx, uuid) && vol_mounted_path(idx, mnt) && std::strlen(mnt) < size) {
            std::memcpy(out, mnt, std::strlen(mnt) + 1);
            found = true;
        }
        return true;
    });
    if (!found)
        out[0] = '\0';
    return found ? kMounted : kNotMounted;
}

int sys_raid_vol_is_unlocked_by_uuid(const char *uuid)
{
    PARAM_GUARD(!uuid);
    int answer = kLocked;
    if (!uuid[0])
        return answer;
    for_each_volume([&](int idx) {
        if (!uuid_matches(idx, uuid))
            return true;
        char mnt[VOL_MNT_PATH_LEN];
        answer = vol_mounted_path(idx, mnt) ? kUnlocked : kLocked;
        return false;
    });
    return answer;
}

/* ---------------------------------------------------------------------------
 * Disk hibernation
 * ------------------------------------------------------------------------- */

int powermgmt_get_hibernate_status(int **states, int disk_cnt)
{
    if (!states || disk_cnt < 0) {
        DBG(0, "parameter error");
        return -1;
    }
    disk_cnt = std::min(disk_cnt, SYSINFO_MAX_ENTRIES);
    std::string out;
    int status = read_output("powermgmt -s", kPowerReadLen, out);
    if (status != 0) {
        // Not run, not found (127) or failed: its answer cannot be trusted.
        DBG(1, "powermgmt failed");
        return -1;
    }
    DBG(1, "powermgmt -s : %s", out.c_str());
    uint32_t mask = parse_result_mask(out);

    auto *arr = static_cast<int *>(std::malloc(sizeof(int) * static_cast<size_t>(std::max(disk_cnt, 1))));
    if (!arr) {
        DBG(0, "malloc failed");
        return -1;
    }
    int asleep = 0;
    for (int i = 0; i < disk_cnt; ++i) {
        arr[i] = static_cast<int>((mask >> (i % 32)) & 1u);
        asleep += arr[i];
        DBG(2, "disk_hibernation: %d", arr[i]);
    }
    *states = arr;
    return disk_cnt - asleep;
}

int xmldb_get_vol_hibernation(int vol_idx, int disk_cnt, const int *states)
{
    PARAM_GUARD(vol_idx < 1 || disk_cnt < 0 || !states);
    char dev[64];
    if (!vol_get(dev, vol_idx, "dev")) {
        DBG(0, "xmldb error at strNode: /vols/vol:%d/dev", vol_idx);
        return ERR_DB_WRITE;
    }
    int md = xmldb_get_md_dbidx_by_md_dev(dev);
    if (md < 1) {
        DBG(0, "fail to search md dev : %s", dev);
        return ERR_SYSINFO;
    }
    char members[512];
    if (xmldb_get_md_raid_disks(md, members, sizeof members) != KORV_OK) {
        DBG(0, "fail to get raid_disks : %s", dev);
        return ERR_SYSINFO;
    }
    char *rest = members;
    while (char *name = strsep_ex(&rest, kMembersSep)) {
        int disk = xmldb_get_disk_dbidx_by_name(name);
        if (disk >= 1 && disk <= disk_cnt && states[disk - 1] == 1)
            return 1;
    }
    return 0;
}

/* ---------------------------------------------------------------------------
 * Room on a volume
 * ------------------------------------------------------------------------- */

int _sys_get_df_info(uint64_t *total, uint64_t *used, uint64_t *unused, const char *mnt_path)
{
    if (!total || !used || !unused || !mnt_path) {
        DBG(0, "parameter error!");
        return -1;
    }
    if (!sys_mount_point(mnt_path)) {
        DBG(0, "mnt_path %s is not a mount point!", mnt_path);
        return -1;
    }
    std::string escaped;
    char cmd[kDfCmdLen];
    if (!korv::shell_escape(mnt_path, escaped) ||
        std::snprintf(cmd, sizeof cmd, "df -B 1 \"%s\" | sed -e /Filesystem/d", escaped.c_str()) >=
            static_cast<int>(sizeof cmd)) {
        DBG(0, "failed to do df -B 1 \"%s\"", mnt_path);
        return -1;
    }
    std::string out;
    if (read_output(cmd, kDfReadLen, out) < 0 || out.find_first_not_of(" \t\n") == std::string::npos) {
        DBG(0, "failed to do %s", cmd);
        return -1;
    }
    DBG(2, "get df output = %s", out.c_str());

    std::string_view line(out);
    line = line.substr(0, line.find('\n'));
    std::string dev(next_field(line));
    DBG(2, "dev = %s", dev.c_str());
    uint64_t size = 0, df_used = 0, avail = 0, pct = 0;
    if (!df_number(next_field(line), "total", size) || !df_number(next_field(line), "df_used", df_used) ||
        !df_number(next_field(line), "available", avail) || !df_number(next_field(line), "used_percent", pct))
        return -1;
    if (pct > 100) {
        DBG(0, "failed to convert %llu%% to number", static_cast<unsigned long long>(pct));
        return -1;
    }

    // A line that does not add up has no reserved blocks to share, and
    // nothing below may wrap.
    uint64_t reserved = 0;
    if (df_used <= size && avail <= size - df_used)
        reserved = size - df_used - avail;
    DBG(2, "reserved size = %llu", static_cast<unsigned long long>(reserved));
    uint64_t not_avail = avail < size ? size - avail : 0;
    auto share = static_cast<uint64_t>((static_cast<unsigned __int128>(100 - pct) * reserved) / 100);
    *total = size;
    *used = not_avail - std::min(share, not_avail);
    *unused = size - *used;
    DBG(2, "return used = %llu, unused = %llu", static_cast<unsigned long long>(*used),
        static_cast<unsigned long long>(*unused));
    return 0;
}

/* ---------------------------------------------------------------------------
 * The chain of volumes with their room
 * ------------------------------------------------------------------------- */

vol_lun_info_t *_vol_info_list_insert(vol_lun_info_t **head, const char *uuid, uint64_t alloc_size,
                                      uint64_t claim_size, uint64_t extra_size, int hibernation)
{
    if (!head || !uuid) {
        DBG(0, "parameter error");
        return nullptr;
    }
    auto *rec = static_cast<vol_lun_info_t *>(std::calloc(1, sizeof(vol_lun_info_t)));
    if (!rec) {
        DBG(0, "malloc vol_lun_info_t failed");
        return nullptr;
    }
    if (!korv::copy_bounded(rec->uuid, uuid) ||
        sys_raid_get_mnt_path_by_uuid(rec->vol_mnt_path, sizeof rec->vol_mnt_path, uuid) != kMounted) {
        DBG(2, "uuid= %s is not exist on vol list", uuid);
        std::free(rec);
        return nullptr;
    }
    uint64_t used = 0;
    if (_sys_get_df_info(&rec->vol_size, &used, &rec->free_size, rec->vol_mnt_path) != 0) {
        DBG(0, "failed to get volume df info!");
        std::free(rec);
        return nullptr;
    }
    rec->init_free_size = rec->free_size;
    DBG(2, "get vol size = %llu, free size = %llu", static_cast<unsigned long long>(rec->vol_size),
        static_cast<unsigned long long>(rec->free_size));
    rec->lun_alloc_size = alloc_size;
    rec->lun_claim_size = claim_size;
    rec->lun_extra_size = extra_size;
    rec->hibernation = hibernation;
    DBG(2, "add new vol_lun_info_t->vol_mnt_path = %s", rec->vol_mnt_path);

    vol_lun_info_t **tail = head;
    while (*tail && (*tail)->next != *tail)
        tail = &(*tail)->next;
    if (*tail)
        (*tail)->next = rec;
    else
        *tail = rec;
    return rec;
}

void vol_lun_info_list_deinit(vol_lun_info_t **head)
{
    if (!head)
        return;
    vol_lun_info_t *rec = *head;
    while (rec) {
        vol_lun_info_t *next = rec->next == rec ? nullptr : rec->next;
        DBG(2, "free vol_lun_info_t->uuid == %s", rec->uuid);
        std::free(rec);
        rec = next;
    }
    *head = nullptr;
}

vol_lun_info_t *vol_lun_info_update(vol_lun_info_t **head, const char *uuid, uint64_t alloc_inc,
                                    uint64_t claim_inc, uint64_t extra_inc, int flag)
{
    if (!head || !uuid) {
        DBG(0, "parameter error");
        return nullptr;
    }
    vol_lun_info_t *rec = *head;
    while (rec && std::strcmp(rec->uuid, uuid) != 0)
        rec = rec->next == rec ? nullptr : rec->next;
    if (!rec)
        return _vol_info_list_insert(head, uuid, alloc_inc, claim_inc, extra_inc, flag);

    rec->lun_alloc_size += alloc_inc;
    rec->lun_claim_size += claim_inc;
    rec->lun_extra_size += extra_inc;
    // Claimed space not yet allocated will be taken from what is free.
    if (rec->free_size != 0 && claim_inc > alloc_inc) {
        uint64_t grow = claim_inc - alloc_inc;
        rec->free_size = grow >= rec->free_size ? 0 : rec->free_size - grow;
    }
    if (flag >= 0)
        rec->hibernation = flag;
    return rec;
}

vol_lun_info_t *vol_lun_info_list_get_nth(vol_lun_info_t *head, int n)
{
    static int cursor = 0;  // one walk at a time, one thread
    int steps = n >= 0 ? n : cursor;
    vol_lun_info_t *rec = head;
    for (int i = 0; rec && i < steps; ++i)
        rec = rec->next == rec ? nullptr : rec->next;
    if (n >= 0)
        cursor = n < INT_MAX ? n + 1 : n;
    else if (rec && cursor < INT_MAX)
        cursor++;
    return rec;
}

int init_root_vol_lun_info(vol_lun_info_t **head, int check)
{
    PARAM_GUARD(!head);
    DBG(2, "start init_root_vol_lun_info");
    int disks = xmldb_get_disk_cnt();
    if (disks < 0) {
        DBG(0, "get disk count from xmldb failed");
        return -1;
    }
    if (disks == 0) {
        DBG(1, "disk count = 0");
        return 1;
    }
    int *states = nullptr;
    int awake = 0;
    if (check == 1) {
        awake = powermgmt_get_hibernate_status(&states, disks);
        if (awake < 0) {
            DBG(0, "get hard disk hibernation failed");
            return awake;
        }
    }
    std::unique_ptr<int, korv::free_deleter> states_owner(states);
    int vols = xmldb_get_vol_cnt();
    if (vols < 0) {
        DBG(0, "get volume count from xmldb failed");
        return -1;
    }
    int rc = 0;
    for (int idx = 1; idx <= vols; ++idx) {
        int flag = 0;
        if (awake == 0)
            flag = 1;  // every disk asleep: no member list is read
        else if (awake > disks)
            flag = 0;
        else if ((flag = xmldb_get_vol_hibernation(idx, disks, states)) < 0) {
            DBG(0, "get volume hibernation failed");
            rc = flag;
            break;
        }
        char uuid[VOL_UUID_LEN];
        if (!vol_get(uuid, idx, "uuid")) {
            DBG(0, "get volume uuid from xmldb failed, vol_idx = %d", idx);
            rc = -1;
            break;
        }
        if (!vol_lun_info_update(head, uuid, 0, 0, 0, flag))
            DBG(1, "update vol lun info failed when uuid = %s", uuid);
    }
    DBG(2, "stop init_root_vol_lun_info");
    return rc;
}

int get_vol_info_list(list_t *list)
{
    if (!list) {
        DBG(2, "vol_list is null");
        return ERR_PARAM;
    }
    if (!list_is_empty(list)) {
        DBG(2, "vol_list is not empty");
        return ERR_PARAM;
    }
    DBG(2, "start get_vol_info_list");
    int rc = korv::fill_and_hand_over(list, vol_info_free_list, [](list_t *got) {
        int fill_rc = KORV_OK;
        for_each_volume([&](int idx) {
            vol_info_t *vol = vol_info_new();
            if (!vol) {
                fill_rc = ERR_NO_MEMORY;
                return false;
            }
            vol_get(vol->uuid, idx, "uuid");
            vol_get(vol->mnt_path, idx, "mnt");
            list_append(&vol->node, got);
            return true;
        });
        return fill_rc;
    });
    if (rc != KORV_OK)
        return rc;
    DBG(2, "finish get_vol_info_list");
    return KORV_OK;
}
