// SPDX-License-Identifier: Apache-2.0
// The driver's backstores, LUN mapping and ACLs against the real kernel
// target, in the test VM, judged by a real initiator: libiscsi logging in
// over the VM's loopback as each initiator in turn. One scenario, from the
// first backstore to the last deletion.
#include <gtest/gtest.h>
#include <iscsi/iscsi.h>
#include <iscsi/scsi-lowlevel.h>

#include <cstdint>
#include <cstring>
#include <string>

#include "common/korvadm_err.h"
#include "tests/vm/vm_targets.h"

namespace {

using namespace vm;

// A session as `initiator` with `iqn` at 127.0.0.1:3260, with CHAP as
// "vmuser" when a secret is given; logged out when it goes. Commands answer
// their SCSI status (-1 when none came back).
class Session {
public:
    Session(const std::string &initiator, const std::string &iqn, const char *secret = nullptr)
        : ctx_(iscsi_create_context(initiator.c_str()))
    {
        iscsi_set_targetname(ctx_, iqn.c_str());
        iscsi_set_session_type(ctx_, ISCSI_SESSION_NORMAL);
        iscsi_set_noautoreconnect(ctx_, 1);
        iscsi_set_timeout(ctx_, 10);
        if (secret)
            iscsi_set_initiator_username_pwd(ctx_, "vmuser", secret);
        up = iscsi_connect_sync(ctx_, "127.0.0.1:3260") == 0 && iscsi_login_sync(ctx_) == 0;
    }
    ~Session()
    {
        if (up && iscsi_is_logged_in(ctx_))
            iscsi_logout_sync(ctx_);
        iscsi_destroy_context(ctx_);
    }

    uint64_t capacity(int lun)  // READ CAPACITY(16) in bytes; 0 when refused
    {
        Task t = run([&] { return iscsi_readcapacity16_sync(ctx_, lun); });
        auto *rc = good(t) ? static_cast<scsi_readcapacity16 *>(scsi_datain_unmarshall(t.get())) : nullptr;
        return rc ? (rc->returned_lba + 1) * rc->block_length : 0;
    }
    int write(int lun, uint64_t lba, std::string data)
    {
        Task t = run([&] {
            return iscsi_write16_sync(ctx_, lun, lba, reinterpret_cast<unsigned char *>(data.data()), 512, 512, 0,
                                      0, 0, 0, 0);
        });
        return t ? t->status : -1;
    }
    std::string read(int lun, uint64_t lba)
    {
        Task t = run([&] { return iscsi_read16_sync(ctx_, lun, lba, 512, 512, 0, 0, 0, 0, 0); });
        return good(t) ? std::string(reinterpret_cast<char *>(t->datain.data), t->datain.size) : "";
    }

    bool up = false;
    int sense = -1;  // of the last command

private:
    using Task = std::unique_ptr<scsi_task, decltype(&scsi_free_scsi_task)>;
    static bool good(const Task &t) { return t && t->status == SCSI_STATUS_GOOD; }
    // Runs a command, again once after the unit attention that the first
    // command on a LUN gets.
    template <class Command>
    Task run(Command command)
    {
        Task t(command(), scsi_free_scsi_task);
        if (t && t->status == SCSI_STATUS_CHECK_CONDITION && t->sense.key == SCSI_SENSE_UNIT_ATTENTION)
            t.reset(command());
        sense = t ? t->sense.key : -1;
        return t;
    }
    iscsi_context *ctx_;
};

using LioStorage = Driver;

const std::string kOwnDir = "/mnt/.systemfile/iscsi_target/fileio";
const std::string kRw = "iqn.2026-01.vm:rw", kRo = "iqn.2026-01.vm:ro", kDeny = "iqn.2026-01.vm:deny";
// Shell metacharacters reach the kernel as the secret itself.
const char *const kSecret = "pa$(x)\"q`z;w1";
constexpr uint64_t kMiB = 1024 * 1024;

TEST_F(LioStorage, AnInitiatorGetsExactlyTheRightsTheDriverSets)
{
    ASSERT_EQ(::system(("mkdir -p " + kOwnDir).c_str()), 0);
    Target t = serve("iqn.2026-01.vm:storage", "127.0.0.1");
    t->dataout_timeout = 5;  // for each ACL added
    const std::string tpg = tpg_dir(t.get());

    // A file the driver creates, and one in the appliance's own directory.
    iscsi_lun_t a = make_lun("disk0", "/tmp/disk0.img", 4 * kMiB, 1, "sn-disk0");
    iscsi_lun_t b = make_lun("disk255", kOwnDir + "/disk255.img", 1 * kMiB, 1);
    ASSERT_EQ(iscsi_mod_add_backstore(&a), 0);
    ASSERT_EQ(iscsi_mod_add_backstore(&b), 0);
    EXPECT_NE(read_file(kCore + "/fileio_1/disk0/wwn/vpd_unit_serial").find("sn-disk0"), std::string::npos);
    EXPECT_TRUE(exists("/var/target/alua/tpgs_sn-disk0"));
    a.size = 2 * kMiB;  // adding it again leaves the device as it was
    EXPECT_EQ(iscsi_mod_add_backstore(&a), 0);
    EXPECT_NE(read_file(kCore + "/fileio_1/disk0/info").find("Size: 4194304"), std::string::npos);

    ASSERT_EQ(iscsi_mod_add_lun_mapping(&a, t.get(), 0), 0);
    ASSERT_EQ(iscsi_mod_add_lun_mapping(&b, t.get(), 255), 0);
    EXPECT_EQ(iscsi_mod_del_backstore(&b), ERR_PARAM) << "a linked backstore went";
    EXPECT_TRUE(exists(b.path));

    for (const std::string &i : {kRw, kRo, kDeny})
        ASSERT_EQ(iscsi_mod_add_acl_initiator(i.c_str(), t.get()), 0) << i;
    ASSERT_EQ(grant(t.get(), 0, kRw, 2) | grant(t.get(), 255, kRw, 2), 0);
    ASSERT_EQ(grant(t.get(), 0, kRo, 1) | grant(t.get(), 255, kDeny, 1), 0);
    ASSERT_EQ(iscsi_mod_enable_target(t.get()), 0);

    // Read-write: the pattern lands in the backing file. Read-only: read,
    // but the write is refused.
    Session rw(kRw, t->iqn), ro(kRo, t->iqn);
    ASSERT_TRUE(rw.up && ro.up);
    EXPECT_EQ(rw.capacity(0), 4 * kMiB);
    EXPECT_EQ(rw.capacity(255), 1 * kMiB);
    std::string pattern(512, '\0');
    for (size_t i = 0; i < pattern.size(); i++)
        pattern[i] = static_cast<char>("korv-lio"[i % 8] ^ (i / 8));
    EXPECT_EQ(rw.write(0, 8, pattern), SCSI_STATUS_GOOD);
    EXPECT_EQ(ro.read(0, 8), pattern);
    EXPECT_EQ(ro.write(0, 9, pattern), SCSI_STATUS_CHECK_CONDITION);
    EXPECT_EQ(ro.sense, SCSI_SENSE_DATA_PROTECTION);

    // Read-only on a live target leaves sessions alone; deny switches the
    // target off (ending its sessions) and on again.
    ASSERT_EQ(grant(t.get(), 0, kDeny, 1), 0);
    EXPECT_EQ(rw.capacity(0), 4 * kMiB) << "read-only disturbed a session";
    ASSERT_EQ(grant(t.get(), 255, kDeny, 0) | grant(t.get(), 0, kDeny, 0), 0);
    EXPECT_EQ(rw.capacity(0), 0u) << "a session outlived deny: the target was not switched off";
    EXPECT_EQ(read_file(tpg + "/enable"), "1\n");
    Session denied(kDeny, t->iqn);
    ASSERT_TRUE(denied.up) << "its ACL admits it";
    EXPECT_EQ(denied.capacity(255), 0u);

    // Without an ACL the default policy (generate_node_acls, which the
    // driver turns on) admits an initiator read-only; with CHAP on, the
    // initiator has no credentials and cannot log in.
    Session stranger("iqn.2026-01.vm:no-acl", t->iqn);
    ASSERT_TRUE(stranger.up);
    EXPECT_EQ(stranger.write(0, 9, pattern), SCSI_STATUS_CHECK_CONDITION);
    // CHAP reaches every ACL, and only the secret written (shell
    // metacharacters included) admits an initiator. One without an ACL has
    // no credentials and cannot log in at all.
    t->chap = t->mutual_chap = 1;
    std::strcpy(t->chap_user, "vmuser");
    std::strcpy(t->chap_pass, kSecret);
    std::strcpy(t->mutual_user, "vmtarget");
    std::strcpy(t->mutual_pass, "mutualsecret1234");
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    EXPECT_EQ(read_file(tpg + "/param/AuthMethod"), "CHAP,None\n");
    for (const std::string &i : {kRw, kRo, kDeny}) {
        const std::string auth = tpg + "/acls/" + i + "/auth/";
        EXPECT_EQ(read_file(auth + "userid") + read_file(auth + "password") +
                      read_file(auth + "userid_mutual") + read_file(auth + "password_mutual"),
                  std::string("vmuser\n") + kSecret + "\nvmtarget\nmutualsecret1234\n") << i;
    }
    EXPECT_FALSE(Session("iqn.2026-01.vm:no-acl", t->iqn, kSecret).up);
    EXPECT_TRUE(Session(kRw, t->iqn, kSecret).up);
    EXPECT_FALSE(Session(kRw, t->iqn).up) << "no secret got in";

    // CHAP off: the switch drops, the credentials stay, no secret is asked.
    t->chap = 0;
    ASSERT_EQ(iscsi_mod_set_target_chap(t.get()), 0);
    EXPECT_EQ(read_file(tpg + "/attrib/authentication") + read_file(tpg + "/acls/" + kRw + "/auth/userid"),
              "0\nvmuser\n");

    // A resize shows in the capacity the initiator reads.
    a.size = 8 * kMiB;
    ASSERT_EQ(iscsi_mod_change_backstore_size(&a), 0);
    EXPECT_EQ(Session(kRw, t->iqn).capacity(0), 8 * kMiB);

    // The data-out time-out reaches every ACL; this kernel takes 2..60
    // seconds and refuses the rest, which the driver logs and answers 0.
    for (int seconds : {7, 61, 0})
        EXPECT_EQ(iscsi_mod_set_dataout_timeout(seconds, t.get()), 0) << seconds;
    for (const std::string &i : {kRw, kRo, kDeny})
        EXPECT_EQ(read_file(tpg + "/acls/" + i + "/attrib/dataout_timeout"), "7\n") << i;

    // Taken apart in the kernel's order: rights, ACLs, mappings, backstores.
    EXPECT_EQ(grant(t.get(), 0, kRw, 0) | grant(t.get(), 0, kRo, 0) | grant(t.get(), 255, kRw, 0), 0);
    for (const std::string &i : {kRw, kRo, kDeny})
        EXPECT_EQ(iscsi_mod_del_acl_initiator(i.c_str(), t.get()), 0) << i;
    EXPECT_EQ(iscsi_mod_del_lun_mapping(&a, t.get()) | iscsi_mod_del_lun_mapping(&b, t.get()), 0);
    EXPECT_EQ(iscsi_mod_del_backstore(&a) | iscsi_mod_del_backstore(&b), 0);
    EXPECT_FALSE(exists(kCore + "/fileio_1/disk0"));
    EXPECT_FALSE(exists(b.path));
}

}  // namespace
