// SPDX-License-Identifier: Apache-2.0
// ACLs: initiators, rights kept on both sides, their removal, the readers,
// and the session access records.
#include "tests/config/store_fixture.h"

using namespace korv_test;

namespace {

class Acl : public SampleStore {
protected:
    // Both sides as text: per initiator "iqn(alias)=lun:right,...", then per
    // LUN "lun=iqn:right,...", each list with its stored count.
    static std::string sides()
    {
        std::string out;
        for (int a = 1; a <= 4; a++) {  // across a gap a delete left
            if (!raw(epath("/iscsi/acl", a, "initiator")).empty())
                out += raw(epath("/iscsi/acl", a, "initiator")) + "(" + raw(epath("/iscsi/acl", a, "alias")) + ")=" +
                       list(epath("/iscsi/acl", a, "mapped_lun"), "lun_name") + " ";
        }
        for (int l = 1; l <= 3; l++)
            out += "l" + std::to_string(l) + "=" + list(lpath(l, "acl"), "initiator") + " ";
        return out;
    }
    static std::string list(const std::string &root, const char *key)
    {
        std::string out;
        for (int n = 1; !raw(epath(root, n, key)).empty(); n++)
            out += raw(epath(root, n, key)) + ":" + raw(epath(root, n, "access_right")) + ",";
        return out + "#" + raw(root + "/count");
    }
};

}  // namespace

TEST_F(Acl, GrantingAddsAnUnknownInitiatorAndWritesBothSides)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_set_lun_acl("iqn.a", "A", "l1", 2), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.a", "A", "l2", 0), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.b", "B", "l2", 1), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.a", "A", "l1", 1), KORV_OK);  // a change, not a second entry
    EXPECT_EQ(sides(), "iqn.a(A)=l1:RO,l2:DENY,#2 iqn.b(B)=l2:RO,#1 l1=iqn.a:RO,#1 l2=iqn.a:DENY,iqn.b:RO,#2 l3=# ");
    EXPECT_EQ(records<lun_acl_conf_t>([](list_t *l) { return xmldb_get_all_lun_acl_conf_from_lun("l2", l); },
                                      lun_acl_conf_free_list),
              "iqn.a/A/0 iqn.b/B/1");
    EXPECT_EQ(slash(raw("/iscsi/acl/count"), xmldb_check_acl_initiaor_exist("iqn.b"), xmldb_check_acl_alias_exist("B"),
                    xmldb_check_add_acl_initiator("iqn.c", "C"), xmldb_check_add_acl_initiator("iqn.c", "A")),
              "2/1/1/0/1");
    char buf[CONF_IQN_LEN];
    EXPECT_EQ(slash(xmldb_get_initiator_name_from_alias(buf, sizeof buf, "B"), buf), "0/iqn.b");
    EXPECT_EQ(xmldb_get_initiator_name_from_alias(buf, 5, "B"), KORV_OK);  // does not fit: none
    EXPECT_STREQ(buf, "");

    // Refused grants write nothing, not even the initiator.
    const struct {
        const char *initiator, *lun, *message;
        int right;
    } refused[] = {
        {"iqn.c", "l1", "access right error", 3},
        {"", "l1", "initiator name error", 1},
        {"iqn.c", "", "lun name error", 1},
        {"iqn.c", "l9", "lun name not exist", 1},
    };
    const std::string before = sides();
    for (const auto &r : refused)
        EXPECT_EQ(logged([&] { return xmldb_set_lun_acl(r.initiator, "C", r.lun, r.right); }, r.message), ERR_PARAM);
    EXPECT_EQ(sides(), before);
}

TEST_F(Acl, RemovalsKeepBothSidesInAgreement)
{
    for (const char *i : {"iqn.a", "iqn.b", "iqn.c"})
        for (const char *l : {"l1", "l2"})
            ASSERT_EQ(quiet([&] { return xmldb_set_lun_acl(i, i + 4, l, 2); }), KORV_OK);
    EXPECT_EQ(xmldb_del_acl_initiator("iqn.a"), KORV_OK);
    EXPECT_EQ(sides(), "iqn.b(b)=l1:RW,l2:RW,#2 iqn.c(c)=l1:RW,l2:RW,#2 "
                       "l1=iqn.c:RW,iqn.b:RW,#2 l2=iqn.c:RW,iqn.b:RW,#2 l3=# ");
    EXPECT_EQ(raw("/iscsi/acl/count"), "2");

    // The initiator's own entry leaves a gap, which the next new initiator fills.
    ASSERT_EQ(quiet([] { return xmldb_set_lun_acl("iqn.a", "a", "l1", 1); }), KORV_OK);
    EXPECT_EQ(xmldb_remove_lun_from_all_acl("l1"), KORV_OK);
    EXPECT_EQ(sides(), "iqn.a(a)=#0 iqn.b(b)=l2:RW,#1 iqn.c(c)=l2:RW,#1 l1=# l2=iqn.c:RW,iqn.b:RW,#2 l3=# ");

    // Half-written pairs are reported and passed over.
    put("/iscsi/lun/id:2/acl/id:1/initiator", "iqn.a");  // a has no l2 on its side
    EXPECT_EQ(logged([] { return xmldb_remove_lun_from_all_acl("l2"); },
                     "error l2 is not exist on initiator iqn.a, the acl might be inconsistency"),
              KORV_OK);
    EXPECT_EQ(logged([] { return xmldb_del_acl_initiator("iqn.c"); },  // l2's side is gone
                     "error iqn.c is not exist on lun l2, the acl might be inconsistency"),
              KORV_OK);
    EXPECT_EQ(sides(), "iqn.a(a)=#0 iqn.b(b)=#0 l1=# l2=# l3=# ");
    EXPECT_EQ(quiet([] { return xmldb_del_acl_initiator("iqn.nobody"); }), ERR_NOT_FOUND);
}

TEST_F(Acl, The130thInitiatorIsRefusedAndNothingIsWritten)
{
    for (int a = 1; a <= 129; a++)
        put(epath("/iscsi/acl", a, "initiator"), "iqn.n" + std::to_string(a));
    EXPECT_EQ(logged([] { return xmldb_set_lun_acl("iqn.new", "N", "l2", 1); },
                     "the maximum number of targets has reached"),
              ERR_NO_ROOM);
    EXPECT_EQ(raw("/iscsi/acl/id:130/initiator") + raw(lpath(2, "acl/id:1/initiator")), "");
    EXPECT_EQ(records<lun_acl_conf_t>([](list_t *l) { return xmldb_get_all_lun_acl_conf_from_lun("l9", l); },
                                      lun_acl_conf_free_list, ERR_NOT_FOUND),
              "");
}

TEST_F(Acl, SessionAccessIsRecordedPerInitiatorAndLun)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_update_sess_acl_lun_access_status("iqn.a", "l1", 3), KORV_OK);
    EXPECT_EQ(xmldb_update_sess_acl_lun_access_status("iqn.b", "l1", 4), KORV_OK);
    EXPECT_EQ(xmldb_update_sess_acl_lun_access_status("iqn.a", "l2", 4294967295u), KORV_OK);
    EXPECT_EQ(xmldb_update_sess_acl_lun_access_status("iqn.a", "l1", 0), KORV_OK);
    const std::string s = "/iscsi/sess/initiator";
    EXPECT_EQ(raw(s + "/count") + raw(s + "/id:1/name") + raw(s + "/id:2/name"), "2iqn.aiqn.b");
    EXPECT_EQ(list(s + "/id:1/access_lun", "lun_name"), "l1:,l2:,#2");
    EXPECT_EQ(raw(s + "/id:1/access_lun/id:1/access_status") + "/" + raw(s + "/id:1/access_lun/id:2/access_status"),
              "0/4294967295");
    EXPECT_EQ(quiet([] { return xmldb_update_sess_acl_lun_access_status(nullptr, "l1", 0); }), ERR_PARAM);
    EXPECT_EQ(xmldb_clean_sess_conf(), KORV_OK);
    EXPECT_EQ(xmldb_clean_acl_conf(), KORV_OK);
    EXPECT_EQ(raw(s + "/id:1/name") + raw("/iscsi/acl/id:1/initiator"), "");
}
