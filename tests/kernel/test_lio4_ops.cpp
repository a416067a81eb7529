// SPDX-License-Identifier: Apache-2.0
// Every slot of the LIO table that names a target, an initiator or a LUN
// refuses a record it cannot use with -9989 before it touches anything (no
// name may leave its directory), and takes a good record past its checks.
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "common/korvadm_err.h"
#include "kernel/korvadm_mod_lio4_internal.h"
#include "kernel/korvadm_sess.h"
#include "tests/kernel/lio4_test.h"

namespace {

using korv_test::Lio4Test;

TEST_F(Lio4Test, EveryOperationRefusesARecordItCannotNameBeforeTouchingAnything)
{
    korv::list_owner ips(iscsi_ip_free_list), sessions(iscsi_sess_free_list), initiators(iscsi_initiator_free_list);
    iscsi_target_t *t = &target;
    iscsi_lun_t *l = &lun;
    const char *name = I1;
    const iscsi_mod_ops_t &ops = lio3_mod_ops;
    const std::vector<std::function<int()>> by_initiator = {
        [&] { return ops.add_acl_initiator(name, t); },
        [&] { return ops.del_acl_initiator(name, t); },
        [&] { return ops.add_lun_acl(&acl); },
        [&] { return ops.del_lun_acl(&acl); },
    };
    std::vector<std::function<int()>> by_target = {
        [&] { return ops.add_target(t); },
        [&] { return ops.del_target(t); },
        [&] { return ops.enable_target(t); },
        [&] { return ops.disable_target(t); },
        [&] { return ops.set_target_chap(t); },
        [&] { return ops.set_target_ip(t); },
        [&] { return lio3_set_target_ip_v2(t); },
        [&] { return ops.set_target_attr_dataout_timeout(5, t); },
        [&] { return ops.get_target_existing_ip_list(ips.get(), t); },
        [&] { return ops.add_lun_mapping(l, t, 3); },
        [&] { return ops.del_lun_mapping(l, t); },
        [&] { return ops.get_target_session(sessions.get(), initiators.get(), t); },
    };
    by_target.insert(by_target.end(), by_initiator.begin(), by_initiator.end());
    const auto &by_target_ref = by_target;
    const std::vector<std::function<int()>> by_lun = {
        [&] { return ops.add_backstore(l); },
        [&] { return ops.del_backstore(l); },
        [&] { return ops.shutdown_backstore(l); },
        [&] { return ops.change_backstore_size(l); },
        [&] { return ops.add_lun_mapping(l, t, 3); },
        [&] { return ops.del_lun_mapping(l, t); },
    };
    const std::string escape = "../../../../../CANARY";
    struct fault {
        const std::vector<std::function<int()>> *ops;
        std::function<void()> spoil;
        const char *what;
    };
    const fault faults[] = {
        {&by_target, [&] { t = map.target = nullptr; }, "no target"},
        {&by_target, [&] { target.iqn[0] = '\0'; }, "empty IQN"},
        {&by_target, [&] { set(target.iqn, "a/b"); }, "IQN a/b"},
        {&by_target, [&] { set(target.iqn, ".."); }, "IQN .."},
        {&by_target, [&] { set(target.iqn, "."); }, "IQN ."},
        {&by_target, [&] { set(target.iqn, escape); }, "IQN escaping"},
        {&by_target, [&] { std::memset(target.iqn, 'q', sizeof target.iqn); }, "IQN without its end"},
        {&by_target, [&] { target.tpgt = -1; }, "tpgt -1"},
        {&by_target, [&] { target.tpgt = 64; }, "tpgt 64"},
        {&by_initiator, [&] { name = nullptr; acl.initiator = nullptr; }, "no initiator"},
        {&by_initiator, [&] { name = ""; init.name[0] = '\0'; }, "empty initiator"},
        {&by_initiator, [&] { name = "a/b"; set(init.name, name); }, "initiator a/b"},
        {&by_initiator, [&] { name = ".."; set(init.name, name); }, "initiator .."},
        {&by_initiator, [&] { name = "."; set(init.name, name); }, "initiator ."},
        {&by_initiator, [&] { name = escape.c_str(); set(init.name, name); }, "initiator escaping"},
        {&by_lun, [&] { l = nullptr; }, "no LUN"},
        {&by_lun, [&] { lun.name[0] = '\0'; }, "empty LUN name"},
        {&by_lun, [&] { set(lun.name, "a/b"); }, "LUN a/b"},
        {&by_lun, [&] { set(lun.name, ".."); }, "LUN .."},
        {&by_lun, [&] { set(lun.name, escape); }, "LUN escaping"},
        {&by_lun, [&] { lun.hba_id = -1; }, "hba -1"},
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
    for (const std::vector<std::function<int()>> *group : {&by_initiator, &by_lun, &by_target_ref}) {
        for (size_t op = 0; op < group->size(); ++op) {
            fresh();
            EXPECT_NE((*group)[op](), ERR_PARAM) << "operation " << op << " refused good records";
            for (const fault &f : faults) {
                if (f.ops != group)
                    continue;
                fresh();
                std::string before = snapshot();
                f.spoil();
                EXPECT_EQ((*group)[op](), ERR_PARAM) << "operation " << op << ", " << f.what;
                EXPECT_EQ(snapshot(), before) << "operation " << op << ", " << f.what;
            }
        }
    }
}

}  // namespace
