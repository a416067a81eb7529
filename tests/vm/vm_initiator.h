// SPDX-License-Identifier: Apache-2.0
// A real iSCSI initiator for the real-kernel suites: libiscsi, logged in
// over the VM's loopback. Header-only; needs libiscsi-dev.
#pragma once

#include <iscsi/iscsi.h>
#include <iscsi/scsi-lowlevel.h>

#include <cstdint>
#include <string>

namespace vm {

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
        uint64_t bytes = 0;
        run([&] { return iscsi_readcapacity16_sync(ctx_, lun); }, [&](scsi_task *t) {
            if (auto *rc = static_cast<scsi_readcapacity16 *>(scsi_datain_unmarshall(t)))
                bytes = (rc->returned_lba + 1) * rc->block_length;
        });
        return bytes;
    }
    int write(int lun, uint64_t lba, std::string data)
    {
        return run([&] {
            return iscsi_write16_sync(ctx_, lun, lba, reinterpret_cast<unsigned char *>(data.data()), 512, 512, 0,
                                      0, 0, 0, 0);
        });
    }
    std::string read(int lun, uint64_t lba)
    {
        std::string out;
        run([&] { return iscsi_read16_sync(ctx_, lun, lba, 512, 512, 0, 0, 0, 0, 0); },
            [&](scsi_task *t) { out.assign(reinterpret_cast<char *>(t->datain.data), t->datain.size); });
        return out;
    }

    bool up = false;
    int sense = -1;  // of the last command

private:
    // Runs a command (again once after the unit attention that the first
    // command on a LUN gets) and hands a good result to `good`.
    template <class Command, class Good = void (*)(scsi_task *)>
    int run(Command command, Good good = [](scsi_task *) {})
    {
        scsi_task *t = command();
        if (t && t->status == SCSI_STATUS_CHECK_CONDITION && t->sense.key == SCSI_SENSE_UNIT_ATTENTION) {
            scsi_free_scsi_task(t);
            t = command();
        }
        int status = t ? t->status : -1;
        sense = t ? t->sense.key : -1;
        if (status == SCSI_STATUS_GOOD)
            good(t);
        if (t)
            scsi_free_scsi_task(t);
        return status;
    }
    iscsi_context *ctx_;
};

}  // namespace vm
