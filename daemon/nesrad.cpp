// SPDX-License-Identifier: Apache-2.0
// nesrad: the iSNS client daemon (start-up, main loop, node list, registration).
#include "daemon/nesrad.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <malloc.h>
#include <netdb.h>
#include <poll.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string_view>

#include "common/korvadm_debug.h"
#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "common/korvadm_sys.h"
#include "common/korvadm_sysroot.h"
#include "common/korvadm_utils.h"
#include "isns/isns_transport.h"
#include "kernel/korvadm_mod.h"

namespace {

constexpr size_t kMaxHostArg = 255;
constexpr const char *kLockFile = "/var/run/nesrad.lock";
constexpr int kLockWaitMs = 20000;     // an old daemon still deregistering
constexpr int kConfigRetryMs = 10000;  // a configuration service restarting
constexpr unsigned kMinCheckMs = 5000;

// Process-wide state of the daemon (one instance).
char g_server_host[256];
volatile sig_atomic_t g_pending_event = -1;  // last signal received, -1: none
unsigned g_poll_interval = NESRAD_POLL_INTERVAL;
int g_registered;
nesrad_node_t *g_iqn_head;
int g_read_rc;  // result of the last read of the targets
// Our signals are blocked outside the waits; g_open_mask lets them in.
bool g_signals_ready;
sigset_t g_open_mask;

bool is_stop(int sig)
{
    return sig == SIGTERM || sig == SIGINT;
}

// Lets held signals in for a moment. True when a stop is pending: a pass
// looks between its exchanges, so that a stop waits for one exchange at most.
bool stop_pending()
{
    if (g_signals_ready) {
        sigset_t held;
        sigprocmask(SIG_SETMASK, &g_open_mask, &held);
        sigprocmask(SIG_SETMASK, &held, nullptr);
    }
    return is_stop(g_pending_event);
}

using korv::copy_bounded;

}  // namespace

iscsi_conf_ctx_t g_nesrad_conf;

/* ==== registered node list ==== */

int conv_str(char *s)
{
    return conv_iqn_str(s, 1);
}

void _iqn_add(const char *iqn, int tpgt)
{
    if (!iqn) {
        DBG(0, "iqn is NULL");
        return;
    }
    auto *rec = new (std::nothrow) nesrad_node_t{};
    if (!rec) {
        DBG(0, "Core_SARecord_Add alloc memory fail");
        return;
    }
    copy_bounded(rec->iqn, sizeof rec->iqn, iqn);
    rec->tpgt = tpgt;
    nesrad_node_t **tail = &g_iqn_head;
    while (*tail)
        tail = &(*tail)->next;
    *tail = rec;
    DBG(1, "add %s:%d", rec->iqn, tpgt);
}

void _iqn_del(const char *iqn)
{
    if (!iqn) {
        DBG(0, "iqn is NULL");
        return;
    }
    for (nesrad_node_t **link = &g_iqn_head; *link; link = &(*link)->next) {
        nesrad_node_t *rec = *link;
        if (std::strcmp(rec->iqn, iqn) == 0) {
            *link = rec->next;
            DBG(1, "del %s", iqn);
            delete rec;
            return;
        }
    }
}

int _iqn_query(const char *iqn)
{
    if (!iqn) {
        DBG(0, "iqn is NULL");
        return -1;
    }
    for (const nesrad_node_t *rec = g_iqn_head; rec; rec = rec->next)
        if (std::strcmp(rec->iqn, iqn) == 0)
            return 0;
    return -1;
}

int _iqn_next(const char *iqn, nesrad_node_t **out)
{
    if (!out)
        return -1;
    if (!iqn) {
        *out = g_iqn_head;
        return g_iqn_head ? 0 : -1;
    }
    for (nesrad_node_t *rec = g_iqn_head; rec; rec = rec->next) {
        if (std::strcmp(rec->iqn, iqn) == 0) {
            *out = rec->next;
            return 0;
        }
    }
    return -1;
}

int _iqn_clear(void)
{
    nesrad_node_t *head = nullptr;
    while (_iqn_next(nullptr, &head) == 0 && head) {
        // Copy the key: _iqn_del frees the record it names.
        char iqn[sizeof head->iqn];
        copy_bounded(iqn, sizeof iqn, head->iqn);
        _iqn_del(iqn);
    }
    return 0;
}

int init_iqn_list(void)
{
    // A refreshed host name, so that a reload after a rename registers under
    // the new entity identifier.
    char host[128] = {};
    if (sys_net_get_host_name(host, sizeof host, 1) == 0) {
        conv_str(host);
        copy_bounded(isns_entity_id, sizeof isns_entity_id, host);
    }

    korv::list_owner targets(target_conf_free_list);

    const iscsi_conf_ops_t *ops = g_nesrad_conf.ops;
    g_read_rc = ops && ops->xmldb_get_all_target_conf_lite ? ops->xmldb_get_all_target_conf_lite(targets.get())
                                                           : ERR_PARAM;
    if (g_read_rc != 0) {
        DBG(0, "get target conf from config failed");
        return -1;
    }
    int count = 0;
    for (target_conf_t *t : korv::list_records<target_conf_t>(targets.get())) {
        if (iscsi_conf_generate_iqn(t->iqn, isns_entity_id, t->name) < 1) {
            DBG(0, "can not get IQN");
            return -1;
        }
        ++count;
        _iqn_add(t->iqn, t->tpgt);
    }
    return count;
}

/* ==== registration ==== */

int ipv4_text_to_bytes(unsigned char out[16], const char *text)
{
    if (!out || !text)
        return -1;
    std::string_view rest(text);
    if (std::count(rest.begin(), rest.end(), '.') != 3)
        return -1;
    std::memset(out, 0, 16);
    out[10] = out[11] = 0xFF;
    for (int i = 0; i < 4; ++i) {
        size_t dot = rest.find('.');
        std::string_view part = rest.substr(0, dot);
        // atoi's reading (leading blanks, a sign, digits, anything after
        // ignored) without its overflow: only the low byte is kept anyway.
        size_t at = 0;
        while (at < part.size() && std::isspace(static_cast<unsigned char>(part[at])))
            ++at;
        const bool negative = at < part.size() && part[at] == '-';
        if (at < part.size() && (part[at] == '-' || part[at] == '+'))
            ++at;
        unsigned v = 0;
        for (; at < part.size() && part[at] >= '0' && part[at] <= '9'; ++at)
            v = (v * 10 + static_cast<unsigned>(part[at] - '0')) & 0xFFu;
        out[12 + i] = static_cast<unsigned char>(negative ? 0u - v : v);
        rest = dot == std::string_view::npos ? std::string_view() : rest.substr(dot + 1);
    }
    return 0;
}

namespace {

// Adds one portal of the given address text; on failure the caller decides
// whether that ends the whole address entry.
enum class portal_rc { added, no_memory, bad_text };

portal_rc add_portal(isns_iscsi_node *node, const char *text, int port, bool v6)
{
    isns_ip_portal *portal = isns_ip_portal_new();
    if (!portal) {
        DBG(0, "new isns_ip_portal failed");
        return portal_rc::no_memory;
    }
    int rc = v6 ? ipv6_text_to_bytes(portal->address, text)
                : ipv4_text_to_bytes(portal->address, text);
    if (rc != 0) {
        isns_ip_portal_free(portal);
        return portal_rc::bad_text;
    }
    portal->port = static_cast<uint32_t>(port);
    isns_iscsi_node_add_portal(node, portal);
    return portal_rc::added;
}

struct node_ptr {
    isns_iscsi_node *p = isns_iscsi_node_new();
    ~node_ptr() { isns_iscsi_node_free(p); }
};

}  // namespace

int get_iscsi_node_from_mod(isns_iscsi_node *node, const char *iqn, int tpgt)
{
    if (!node || !iqn || tpgt < 0)
        return -1;
    copy_bounded(node->name, sizeof node->name, iqn);
    node->pg_tag = static_cast<uint32_t>(tpgt);

    korv::list_owner ips(iscsi_ip_free_list);

    if (iscsi_mod_get_target_ip_list_in_target_parm(ips.get(), iqn, tpgt) != 0) {
        DBG(0, "can not get target ip");
        return -1;
    }
    for (iscsi_ip_t *ip : korv::list_records<iscsi_ip_t>(ips.get())) {
        // A failed IPv4 half drops the whole entry, its IPv6 half included.
        if (ip->ipv4[0] && add_portal(node, ip->ipv4, ip->port, false) != portal_rc::added)
            continue;
        if (ip->ipv6[0])
            add_portal(node, ip->ipv6, ip->port, true);
    }
    return 0;
}

int target_register_entity_identifier(const char *iqn, int tpgt)
{
    DBG(1, "register entity=%s", iqn ? iqn : "");
    node_ptr node;
    if (get_iscsi_node_from_mod(node.p, iqn, tpgt) != 0)
        return -1;
    copy_bounded(isns_entity_name, sizeof isns_entity_name, iqn);
    register_entity(node.p);
    return 0;
}

int target_register_iSNS_single(const char *iqn, int tpgt)
{
    DBG(1, "write tpginfo: iqn=%s", iqn ? iqn : "");
    node_ptr node;
    if (get_iscsi_node_from_mod(node.p, iqn, tpgt) != 0)
        return -1;
    DBG(1, "register iqn=%s", iqn);
    register_node(node.p);
    return 0;
}

int target_register_iSNS_all(void)
{
    nesrad_node_t *rec = nullptr;
    if (_iqn_next(nullptr, &rec) != 0 || !rec) {
        DBG(1, "there is no iSCSI target");
        return -1;
    }
    target_register_entity_identifier(rec->iqn, rec->tpgt);
    for (rec = rec->next; rec && !stop_pending(); rec = rec->next)
        target_register_iSNS_single(rec->iqn, rec->tpgt);
    return 0;
}

int target_deregister_entity_identifier(void)
{
    DBG(1, "deregister entity=%s", isns_entity_name);
    deregister_entity(isns_entity_name);
    std::memset(isns_entity_name, 0, sizeof isns_entity_name);
    return 0;
}

/* ==== entry and main loop ==== */

int write_pid(int on)
{
    const iscsi_conf_ops_t *ops = g_nesrad_conf.ops;
    int rc = ERR_PARAM;
    if (ops && ops->xmldb_set_nesrad_pid)
        rc = ops->xmldb_set_nesrad_pid(on ? static_cast<int>(getpid()) : 0);
    if (rc != 0)
        DBG(0, "Failed to write nesrad pid!");
    return rc;
}

unsigned nesrad_check_interval_ms(unsigned poll_interval, unsigned period)
{
    const unsigned long long poll_ms = poll_interval * 1000ULL;
    if (period == 0 || period * 1000ULL >= 2 * poll_ms)
        return static_cast<unsigned>(poll_ms);
    return std::max(kMinCheckMs, static_cast<unsigned>(period * 2000ULL / 3));
}

namespace {

constexpr int kOurSignals[] = {SIGUSR1, SIGUSR2, SIGTERM, SIGINT};

// Handlers never nest (each blocks the others), and a pending stop is never
// replaced by a reload.
void on_signal(int sig)
{
    if (!is_stop(g_pending_event))
        g_pending_event = sig;
}

long long mono_ms()
{
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

// Waits with our signals open. Returns false as soon as an event is pending.
// Outside the waits they stay blocked, so a signal sent during an exchange is
// held and delivered at the next look, never lost.
bool wait_ms(long long ms)
{
    const long long end = mono_ms() + ms;
    while (g_pending_event == -1) {
        const long long left = end - mono_ms();
        if (left <= 0)
            return true;
        const timespec ts{static_cast<time_t>(left / 1000), static_cast<long>(left % 1000) * 1000000L};
        ppoll(nullptr, 0, &ts, &g_open_mask);
    }
    return false;
}

// At exit: 0 goes only over our own pid, never over a successor's.
void clear_pid()
{
    const iscsi_conf_ops_t *ops = g_nesrad_conf.ops;
    int stored = 0;
    if (ops && ops->xmldb_get_nesrad_pid && ops->xmldb_get_nesrad_pid(&stored) == 0 &&
        stored == static_cast<int>(getpid()))
        write_pid(0);
}

// One daemon per system root. A restarted daemon waits here while the old one
// deregisters, so that it registers and stores its pid only after it. 0, or
// the exit status 1. The descriptor stays open: the lock lasts until exit.
int take_lock()
{
    const std::string path = sysroot_path(kLockFile);
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0644);
    if (fd < 0) {
        // Better unguarded than no registration at all.
        DBG(0, "cannot open %s: %s", path.c_str(), std::strerror(errno));
        return 0;
    }
    const long long end = mono_ms() + kLockWaitMs;
    for (bool said = false; flock(fd, LOCK_EX | LOCK_NB) != 0;) {
        if (errno != EWOULDBLOCK && errno != EINTR) {
            DBG(0, "cannot lock %s: %s", path.c_str(), std::strerror(errno));
            return 0;
        }
        if (mono_ms() >= end) {
            std::puts("another nesrad is running");
            close(fd);
            return 1;
        }
        if (!said)
            DBG(1, "waiting for the running nesrad to stop");
        said = true;
        usleep(100000);
    }
    return 0;
}

// Resolves the server once into the transport's address globals.
// 0, or the exit status 1 after printing why.
int resolve_server(const char *host)
{
    // A plain numeric address needs no lookup. Parsing it here gives what
    // getaddrinfo would (one result of that family) without its result
    // sorting, which enumerates interfaces and reads gai.conf and costs the
    // daemon about 300 KiB of resident memory. Other forms (host names,
    // scoped or abbreviated addresses) still go through getaddrinfo.
    unsigned char numeric[sizeof(in6_addr)];
    sockaddr_storage addr{};
    const void *raw = nullptr;
    int family = AF_UNSPEC;
    for (int f : {AF_INET, AF_INET6}) {
        if (!raw && inet_pton(f, host, numeric) == 1) {
            family = f;
            raw = numeric;
        }
    }
    if (!raw) {
        addrinfo hints{};
        hints.ai_family = AF_UNSPEC;
        hints.ai_socktype = SOCK_STREAM;
        addrinfo *res = nullptr;
        int rc = getaddrinfo(host, nullptr, &hints, &res);
        if (rc != 0 || !res) {
            DBG(1, "getaddrinfo return %s\n", gai_strerror(rc));
            if (res)
                freeaddrinfo(res);
            return 1;
        }
        // Only the first answer counts, whatever the other families offer.
        family = res->ai_family;
        std::memcpy(&addr, res->ai_addr,
                    res->ai_addrlen < sizeof addr ? res->ai_addrlen : sizeof addr);
        freeaddrinfo(res);
        if (family == AF_INET)
            raw = &reinterpret_cast<sockaddr_in *>(&addr)->sin_addr;
        else if (family == AF_INET6)
            raw = &reinterpret_cast<sockaddr_in6 *>(&addr)->sin6_addr;
    }

    std::memset(isns_server_addr, 0, sizeof isns_server_addr);
    if (!raw) {
        DBG(0, "get ip address failed");
        return 1;
    }
    if (!inet_ntop(family, raw, isns_server_addr, sizeof isns_server_addr)) {
        std::puts("get address failed");
        std::fflush(stdout);
        DBG(0, "inet_ntop failed");
        return 1;
    }
    isns_addr_family = family;
    DBG(1, "resolve address as %s", isns_server_addr);
    return 0;
}

// Reads the targets. A configuration service that does not answer (a client
// failure, not a bad record) is asked again once a second for up to 10 s; a
// stop ends the waiting, a reload is what the next read does anyway.
int load_targets()
{
    const long long end = mono_ms() + kConfigRetryMs;
    int count;
    while ((count = init_iqn_list()) < 0 && g_read_rc == ERR_DB_CLIENT && mono_ms() < end &&
           !is_stop(g_pending_event)) {
        _iqn_clear();
        DBG(0, "configuration service not answering, reading again");
        wait_ms(1000);
        if (!is_stop(g_pending_event))
            g_pending_event = -1;
    }
    return count;
}

enum class wake { reload, stop };

// The waiting states (Registered, Unregistered, Idle) of one pass: signal
// checks, one interval, then exactly one server check. Returns how the pass
// ends.
wake wait_for_event(int count)
{
    // A registration period shorter than two intervals is beaten by checking
    // more often: a query from the entity's node refreshes it on the server.
    const unsigned interval_ms = nesrad_check_interval_ms(g_poll_interval, isns_registration_period);
    for (;;) {
        const int ev = g_pending_event;
        if (ev == SIGUSR1 || ev == SIGUSR2) {
            DBG(1, "Received event %s(%d)", ev == SIGUSR1 ? "SIGUSR1" : "SIGUSR2", ev);
            g_pending_event = -1;
            g_registered = 0;
            return wake::reload;
        }
        if (is_stop(ev)) {
            DBG(1, "Received event %s(%d)", ev == SIGINT ? "SIGINT" : "SIGTERM", ev);
            return wake::stop;
        }
        if (!wait_ms(interval_ms) || count <= 0)
            continue;

        int r = isns_check_registration(isns_entity_name);
        if (g_registered) {
            if (r == 0) {
                DBG(1, "our data on server has been delete, reinit");
                g_registered = 0;
                return wake::reload;
            }
            if (r == -1) {
                DBG(1, "server failed");
                g_registered = 0;
            }
        } else if (r != -1) {
            DBG(1, "ret = %d, server is back, reinit", r);
            return wake::reload;
        }
    }
}

constexpr const char kUsage[] =
    "usage: nesrad <server>\n"
    "Keeps this appliance's iSCSI targets registered with the iSNS server\n"
    "<server> (host name or IPv4/IPv6 address; TCP port 3205). Targets and\n"
    "settings come from the configuration database.\n"
    "SIGUSR1, SIGUSR2: read the targets again and register them again.\n"
    "SIGTERM, SIGINT: deregister and exit.";

}  // namespace

int nesrad_main(int argc, char **argv, unsigned poll_interval)
{
    const char *arg = argc > 1 ? argv[1] : nullptr;
    // Host names never start with '-': no server is lost to these two.
    if (arg && std::strcmp(arg, "--help") == 0) {
        std::puts(kUsage);
        return 0;
    }
    if (arg && std::strcmp(arg, "--version") == 0) {
        std::puts("nesrad " NESRAD_VERSION);
        return 0;
    }
    if (!arg || !arg[0]) {
        std::puts("isns host address not given");
        return 1;
    }
    if (std::strlen(arg) > kMaxHostArg) {
        std::printf("isns host address length exceed max len = %u\n",
                    static_cast<unsigned>(kMaxHostArg));
        return 1;
    }
    g_poll_interval = poll_interval;

    int rc = iscsi_conf_init(&g_nesrad_conf);
    if (rc == ERR_CONF_TYPE) {
        std::puts("not supported config type");
        return 1;
    }
    if (rc != 0) {
        std::puts("get config failed");
        return 1;
    }
    dbg_get_conf_target_debug_lv(&g_nesrad_conf);  // sets the process-wide level
    iscsi_mod_select(2);

    copy_bounded(g_server_host, sizeof g_server_host, arg);
    if (resolve_server(g_server_host) != 0 || take_lock() != 0)
        return 1;

    // Block our signals before the handler exists and before the pid is
    // published: the management tool may signal as soon as it reads the pid.
    sigset_t ours;
    sigemptyset(&ours);
    for (int sig : kOurSignals)
        sigaddset(&ours, sig);
    sigprocmask(SIG_BLOCK, &ours, &g_open_mask);
    struct sigaction sa{};
    sa.sa_handler = on_signal;
    sa.sa_mask = ours;
    for (int sig : kOurSignals) {
        sigdelset(&g_open_mask, sig);
        sigaction(sig, &sa, nullptr);
    }
    g_signals_ready = true;

    write_pid(1);

    for (;;) {
        int count = load_targets();
        if (count < 0 && !is_stop(g_pending_event)) {
            // The pid stays stored, as of a daemon that died.
            _iqn_clear();
            return -1;
        }
        if (count > 0 && target_register_iSNS_all() == 0)
            g_registered = 1;
        // The target records read for the pass are freed by now: their pages
        // go back to the system for the long waits. The node list stays
        // until the clean-up, as the daemon's record of what it registered.
        malloc_trim(0);

        wake how = wait_for_event(count);

        target_deregister_entity_identifier();
        _iqn_clear();
        if (how == wake::stop) {
            clear_pid();
            return 0;
        }
    }
}
