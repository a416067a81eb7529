// SPDX-License-Identifier: Apache-2.0
// Every slot of the LIO table that names a target, an initiator or a LUN
// refuses a record it cannot use with -9989 before it touches anything (no
// name may leave its directory), and takes a good record past its checks.
#include <functional>

#include "tests/kernel/lio4_test.h"

namespace {

using korv_test::Lio4Test;

// What an operation names, so which spoiled record it must refuse. Every
// name goes through one component check: "." and ".." are tried on the IQN.
enum names { T = 1, I = 2, L = 4 };

TEST_F(Lio4Test, EveryOperationRefusesARecordItCannotNameBeforeTouchingAnything)
{
    korv::list_owner ips(iscsi_ip_free_list), sessions(iscsi_sess_free_list), initiators(iscsi_initiator_free_list);
    iscsi_target_t *t = &target;
    iscsi_lun_t *l = &lun;
    const char *name = I1;
    const iscsi_mod_ops_t &ops = lio3_mod_ops;
    const struct {
        int names;
        const char *op;
        std::function<int()> call;
    } operations[] = {
        {T, "add_target", [&] { return ops.add_target(t); }},
        {T, "del_target", [&] { return ops.del_target(t); }},
        {T, "enable_target", [&] { return ops.enable_target(t); }},
        {T, "disable_target", [&] { return ops.disable_target(t); }},
        {T, "set_target_chap", [&] { return ops.set_target_chap(t); }},
        {T, "set_target_ip", [&] { return ops.set_target_ip(t); }},
        {T, "set_target_ip_v2", [&] { return lio3_set_target_ip_v2(t); }},
        {T, "dataout_timeout", [&] { return ops.set_target_attr_dataout_timeout(5, t); }},
        {T, "existing_ip_list", [&] { return ops.get_target_existing_ip_list(ips.get(), t); }},
        {T, "get_target_session", [&] { return ops.get_target_session(sessions.get(), initiators.get(), t); }},
        {T | L, "add_lun_mapping", [&] { return ops.add_lun_mapping(l, t, 3); }},
        {T | L, "del_lun_mapping", [&] { return ops.del_lun_mapping(l, t); }},
        {T | I, "add_acl_initiator", [&] { return ops.add_acl_initiator(name, t); }},
        {T | I, "del_acl_initiator", [&] { return ops.del_acl_initiator(name, t); }},
        {T | I, "add_lun_acl", [&] { return ops.add_lun_acl(&acl); }},
        {T | I, "del_lun_acl", [&] { return ops.del_lun_acl(&acl); }},
        {L, "add_backstore", [&] { return ops.add_backstore(l); }},
        {L, "del_backstore", [&] { return ops.del_backstore(l); }},
        {L, "shutdown_backstore", [&] { return ops.shutdown_backstore(l); }},
        {L, "change_backstore_size", [&] { return ops.change_backstore_size(l); }},
    };
    const struct {
        int names;
        const char *what;
        std::function<void()> spoil;
    } faults[] = {
        {T, "no target", [&] { t = map.target = nullptr; }},
        {T, "empty IQN", [&] { target.iqn[0] = '\0'; }},
        {T, "IQN a/b", [&] { set(target.iqn, "a/b"); }},
        {T, "IQN ..", [&] { set(target.iqn, ".."); }},
        {T, "IQN .", [&] { set(target.iqn, "."); }},
        {T, "IQN without its end", [&] { std::memset(target.iqn, 'q', sizeof target.iqn); }},
        {T, "tpgt -1", [&] { target.tpgt = -1; }},
        {T, "tpgt 64", [&] { target.tpgt = 64; }},
        {I, "no initiator", [&] { name = nullptr; acl.initiator = nullptr; }},
        {I, "empty initiator", [&] { name = ""; set(init.name, name); }},
        {I, "initiator a/b", [&] { name = "a/b"; set(init.name, name); }},
        {L, "no LUN", [&] { l = nullptr; }},
        {L, "empty LUN name", [&] { lun.name[0] = '\0'; }},
        {L, "LUN a/b", [&] { set(lun.name, "a/b"); }},
        {L, "hba -1", [&] { lun.hba_id = -1; }},
    };
    auto fresh = [&] {
        SetUp();
        load_tree("tpg_storage.tree");
        write_file(lun.path, "");
        lun.lun_num = 3;
        t = &target;
        l = &lun;
        name = I1;
    };
    for (const auto &o : operations) {
        fresh();
        EXPECT_NE(o.call(), ERR_PARAM) << o.op << " refused good records";
        for (const auto &f : faults) {
            if (!(f.names & o.names))
                continue;
            fresh();
            auto before = snapshot();
            f.spoil();
            EXPECT_EQ(o.call(), ERR_PARAM) << o.op << ", " << f.what;
            EXPECT_EQ(snapshot(), before) << o.op << ", " << f.what;
        }
    }
}

}  // namespace
