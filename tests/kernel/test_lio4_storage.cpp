// SPDX-License-Identifier: Apache-2.0
// Backstores and LUN mapping on plain directories: what a value may never
// do and what a failed step leaves. What the kernel makes of the steps
// (devices, sizes, links, their order) is the VM suite's part.
#include "tests/kernel/lio4_test.h"

namespace {

using Lio4Storage = korv_test::Lio4Test;

TEST_F(Lio4Storage, PathsSerialsAndSizesThatCannotBeUsedAreRefusedBeforeAnythingIsMade)
{
    const std::pair<char *, std::string> bad[] = {
        {lun.path, ""}, {lun.serial, "../s"}, {lun.serial, "s\n"},
        {lun.path, at("/x.img,fd_dev_name=/etc/passwd")},  // would add a control key of its own
        {lun.path, at("/x.img\nfd_dev_size=1")},
    };
    for (const auto &[field, value] : bad) {
        SetUp();
        std::snprintf(field, 128, "%s", value.c_str());
        EXPECT_EQ(lio3_add_backstore(&lun), ERR_PARAM) << value;
    }
    SetUp();
    lun.size = 0;  // the kernel would compute a capacity below zero
    EXPECT_EQ(lio3_add_backstore(&lun), ERR_PARAM);
    EXPECT_EQ(lio3_change_backstore_size(&lun), ERR_PARAM);
    EXPECT_FALSE(exists(at("/sys")) || exists(at("/data")));

    // Shell syntax in the path reaches the attribute as text; run, it would
    // make the canary in the shell's working directory.
    SetUp();
    mkdirs(at("/data"));
    ASSERT_EQ(chdir(root().c_str()), 0);
    set(lun.path, at("/data/$(touch CANARY)`touch CANARY`\";touch CANARY;x.img"));
    ASSERT_EQ(lio3_add_backstore(&lun), 0);
    EXPECT_EQ(read_file(at(CORE + "/fileio_0/disk1/control")),
              std::string("fd_dev_name=") + lun.path + ",fd_dev_size=1048576,fd_buffered_io=1");
    EXPECT_FALSE(exists(at("/CANARY")));
}

TEST_F(Lio4Storage, AFailedStepTakesBackWhatItMade)
{
    // Plain directories have no wwn/ group for the serial: the device, the
    // HBA directory and the new file go again; an existing file stays.
    mkdirs(at("/data"));
    set(lun.serial, "sn1");
    EXPECT_EQ(lio3_add_backstore(&lun), ERR_CONFIGFS);
    EXPECT_FALSE(exists(lun.path) || exists(at(CORE + "/fileio_0")));
    write_file(lun.path, "data");
    EXPECT_EQ(lio3_add_backstore(&lun), ERR_CONFIGFS);
    EXPECT_EQ(read_file(lun.path), "data");
    lun.hba_id = 5;
    EXPECT_EQ(lio3_change_backstore_size(&lun), ERR_BACKSTORE_MISSING);
    set(lun.name, "gone");
    EXPECT_EQ(lio3_shutdown_backstore(&lun), 0) << "an absent backstore is shut down";
}

TEST_F(Lio4Storage, DeleteRemovesOnlyFilesReallyInTheAppliancesDirectory)
{
    std::string own = at("/.systemfile/iscsi_target/fileio");
    write_file(own + "/disk1.img", "");
    write_file(at("/etc/x"), "keep");
    ASSERT_EQ(symlink(at("/etc/x").c_str(), (own + "/link.img").c_str()), 0);
    for (const std::string &path : {own + "/../../../etc/x", own + "/link.img", own + "/disk1.img"}) {
        load_tree("tpg_storage.tree");
        set(lun.path, path);
        EXPECT_EQ(lio3_del_backstore(&lun), 0) << path;
        EXPECT_FALSE(exists(at(CORE + "/fileio_0/disk1")));
    }
    EXPECT_EQ(read_file(at("/etc/x")), "keep");
    EXPECT_FALSE(exists(own + "/disk1.img"));
}

TEST_F(Lio4Storage, MappingChecksThenSetsTheAluaSwitchAndTakesItsStateBack)
{
    load_tree("tpg_storage.tree");
    std::string l0 = tpg() + "/lun/lun_0";
    EXPECT_EQ(lio3_add_lun_mapping(&lun, &target, 0), ERR_BACKING_FILE_MISSING);
    write_file(lun.path, "");
    EXPECT_EQ(lio3_add_lun_mapping(&lun, &target, 256), ERR_PARAM);
    EXPECT_FALSE(exists(l0));

    ASSERT_EQ(lio3_add_lun_mapping(&lun, &target, 0), 0);
    EXPECT_EQ(read_file(l0 + "/alua_tg_pt_write_md"), "1");
    EXPECT_EQ(lio3_add_lun_mapping(&lun, &target, 0), ERR_LUN_ALREADY_MAPPED);
    EXPECT_EQ(lio3_add_lun_mapping(&lun, &target, 1), ERR_PARAM);  // the record says 0

    // The kernel's attributes are left to go with the group (here by hand),
    // and the group's ALUA state with it.
    EXPECT_EQ(lio3_del_lun_mapping(&lun, &target), ERR_CONFIGFS);
    std::remove((l0 + "/alua_tg_pt_write_md").c_str());
    EXPECT_EQ(lio3_del_lun_mapping(&lun, &target), 0);
    EXPECT_FALSE(exists(l0) || exists(at("/var/target/alua/iSCSI/iqn.2026-01.test:t1+1/lun_0")));
    lun.hba_id = 3;
    EXPECT_EQ(lio3_del_lun_mapping(&lun, &target), ERR_BACKSTORE_MISSING);
}

}  // namespace
