// SPDX-License-Identifier: Apache-2.0
// ACLs: initiators, rights kept on both sides, their removal, the readers,
// and the session access records.
#include "tests/config/store_fixture.h"

using namespace korv_test;

namespace {

// Both sides of the rights: the initiators' and the LUNs'.
class Acl : public SampleStore {
protected:
    static std::string sides() { return dump("/iscsi/acl") + dump("/iscsi/lun"); }
};

}  // namespace

TEST_F(Acl, GrantingAddsAnUnknownInitiatorAndWritesBothSides)
{
    EXPECT_EQ(iscsi_conf_ops.xmldb_set_lun_acl("iqn.a", "A", "l1", 2), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.a", "A", "l2", 0), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.b", "B", "l2", 1), KORV_OK);
    EXPECT_EQ(xmldb_set_lun_acl("iqn.a", "A", "l1", 1), KORV_OK);  // a change, not a second entry
    EXPECT_EQ(sides(), data("acl_granted.txt"));
    EXPECT_EQ(records<lun_acl_conf_t>([](list_t *l) { return xmldb_get_all_lun_acl_conf_from_lun("l2", l); },
                                      lun_acl_conf_free_list),
              "iqn.a/A/0 iqn.b/B/1");
    EXPECT_EQ(slash(xmldb_check_acl_initiaor_exist("iqn.b"), xmldb_check_acl_alias_exist("B"),
                    xmldb_check_add_acl_initiator("iqn.c", "C"), xmldb_check_add_acl_initiator("iqn.c", "A")),
              "1/1/0/1");
    char buf[CONF_IQN_LEN];
    EXPECT_EQ(slash(xmldb_get_initiator_name_from_alias(buf, sizeof buf, "B"), buf), "0/iqn.b");
    EXPECT_EQ(slash(xmldb_get_initiator_name_from_alias(buf, 5, "B"), buf), "0/");  // does not fit: none

    // Refused grants write nothing, not even the initiator.
    EXPECT_EQ(logged([] { return xmldb_set_lun_acl("iqn.c", "C", "l1", 3); }, "access right error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_acl("", "C", "l1", 1); }, "initiator name error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_acl("iqn.c", "C", "", 1); }, "lun name error"), ERR_PARAM);
    EXPECT_EQ(logged([] { return xmldb_set_lun_acl("iqn.c", "C", "l9", 1); }, "lun name not exist"), ERR_PARAM);
    EXPECT_EQ(sides(), data("acl_granted.txt"));
}

TEST_F(Acl, RemovalsKeepBothSidesInAgreement)
{
    for (const char *i : {"iqn.a", "iqn.b", "iqn.c"})
        for (const char *l : {"l1", "l2"})
            ASSERT_EQ(quiet([&] { return xmldb_set_lun_acl(i, i + 4, l, 2); }), KORV_OK);
    EXPECT_EQ(xmldb_del_acl_initiator("iqn.a"), KORV_OK);
    EXPECT_EQ(sides(), data("acl_a_deleted.txt"));

    // The initiator's own entry leaves a gap, which the next new initiator fills.
    ASSERT_EQ(quiet([] { return xmldb_set_lun_acl("iqn.a", "a", "l1", 1); }), KORV_OK);
    EXPECT_EQ(xmldb_remove_lun_from_all_acl("l1"), KORV_OK);
    EXPECT_EQ(sides(), data("acl_l1_removed.txt"));

    // Half-written pairs are reported and passed over.
    put("/iscsi/lun/id:2/acl/id:1/initiator", "iqn.a");  // a has no l2 on its side
    EXPECT_EQ(logged([] { return xmldb_remove_lun_from_all_acl("l2"); },
                     "error l2 is not exist on initiator iqn.a, the acl might be inconsistency"),
              KORV_OK);
    EXPECT_EQ(logged([] { return xmldb_del_acl_initiator("iqn.c"); },  // l2's side is gone
                     "error iqn.c is not exist on lun l2, the acl might be inconsistency"),
              KORV_OK);
    EXPECT_EQ(sides(), data("acl_inconsistent_removed.txt"));
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
    EXPECT_EQ(dump("/iscsi/sess"), data("sess_access.txt"));
    EXPECT_EQ(quiet([] { return xmldb_update_sess_acl_lun_access_status(nullptr, "l1", 0); }), ERR_PARAM);
    EXPECT_EQ(xmldb_clean_sess_conf(), KORV_OK);
    EXPECT_EQ(xmldb_clean_acl_conf(), KORV_OK);
    EXPECT_EQ(dump("/iscsi/sess") + dump("/iscsi/acl"), "");
}
