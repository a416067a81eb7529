// SPDX-License-Identifier: Apache-2.0
// Starting, signalling and stopping nesrad from the management tool.
#include "common/korvadm_nesrad_if.h"

#include "common/korvadm_err.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "config/korvadm_xmldb_conf.h"
#include "kernel/korvadm_mod.h"
#include "platform/platform_util.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unistd.h>

namespace {

constexpr const char *kStopDaemon = "killall -SIGTERM nesrad 1>/dev/null 2>/dev/null";

}  // namespace

char *_insert_back_slash_strdup(const char *text)
{
    // The tool's messages for these two end with an empty line (they were puts).
    if (!text) {
        DBG(0, "parameter error!\n");
        return nullptr;
    }
    std::string escaped;
    char *copy = korv::shell_escape(text, escaped) ? strdup(escaped.c_str()) : nullptr;
    if (!copy)
        DBG(0, "fail to allocate mem!\n");
    return copy;
}

void notify_isnsclient(int sig)
{
    int pid = 0;
    if (xmldb_get_nesrad_pid(&pid) != KORV_OK) {
        DBG(2, "can not get nesrad pid");
        return;
    }
    if (pid <= 0)
        return;
    DBG(1, "sigact=%d", sig);
    kill(pid, sig);
    sleep(1);
}

int isns_set_ctl_module(uint32_t state, const char *server)
{
    if (state == 1 && (!server || !server[0])) {
        DBG(0, "state = 1, but ip is empty");
        return ERR_PARAM;
    }
    DBG(1, "isns_set_ctl_module(%u, %s)", state, server ? server : "(null)");
    // One daemon at a time: every start is preceded by a stop by name.
    System("%s", kStopDaemon);
    if (state == 0)
        return KORV_OK;

    korv::c_buffer escaped(_insert_back_slash_strdup(server));
    if (!escaped) {
        DBG(0, "failed to _insert_back_slash_strdup!");
        return ERR_NO_MEMORY;
    }
    char *raw = nullptr;
    if (asprintf(&raw, "nesrad \"%s\" &", escaped.get()) < 0)
        raw = nullptr;
    korv::c_buffer cmd(raw);
    if (!cmd || !cmd.get()[0]) {
        DBG(0, "failed to asprintf!");
        return ERR_NO_MEMORY;
    }
    DBG(3, "call nesrad by cmd: %s", cmd.get());
    if (system(cmd.get()) == 0)
        return KORV_OK;
    DBG(0, "system() of cmd '%s' failed", cmd.get());
    return ERR_SHELL_START;
}

int isns_factory_reset(void)
{
    if (iscsi_mod_get_state() == 0) {
        int enabled = 0;
        if (xmldb_get_nesrad_enable(&enabled) != KORV_OK) {
            DBG(2, "get_nesrad_state fail");
            enabled = 1;
        }
        if (enabled)
            System("%s", kStopDaemon);
    }
    if (xmldb_clean_nesrad_conf() != KORV_OK) {
        DBG(0, "reset isns config fail");
        return ERR_DB_WRITE;
    }
    return KORV_OK;
}

int isns_set_setting(int state, const char *server, int use_stored)
{
    if (state != 0 && state != 1)
        return ERR_PARAM;
    DBG(2, "isns_set_setting %d, %s, %d", state, server ? server : "(null)", use_stored);

    int service = 0;
    if (xmldb_get_service_enable(&service) != KORV_OK)
        service = 0;
    int stored_state = 0;
    if (xmldb_get_nesrad_enable(&stored_state) != KORV_OK) {
        DBG(2, "get_nesrad_state fail");
        stored_state = 1;
    }
    char stored[256] = {};
    xmldb_get_nesrad_ip(stored, sizeof(stored) - 1);
    const char *wanted = (use_stored || !server) ? stored : server;

    if (service) {
        const bool unchanged = state == 1 && stored_state == 1 && std::strcmp(wanted, stored) == 0;
        if (!unchanged && isns_set_ctl_module(static_cast<uint32_t>(state), wanted) != KORV_OK)
            DBG(0, "set nesrad failed");
    }
    if (xmldb_set_nesrad_enable(state) != KORV_OK)
        DBG(0, "set_nesrad_state = %d failed ", state);
    if (xmldb_set_nesrad_ip(wanted) != KORV_OK)
        DBG(0, "set_nesrad_ip = |%s| failed ", wanted);
    xmldb_save_conf();
    return KORV_OK;
}
