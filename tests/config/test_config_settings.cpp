// Service settings, versions, saved names and addresses, the whole-store
// operations, and the operations table's shape.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "tests/config/store_fixture.h"
#include "tests/support/capture.h"

using korv_test::quiet;
using korv_test::StoreTest;

using SettingsVersion = StoreTest;

TEST_F(SettingsVersion, FallsBackToTheAclCounterThenToZero)
{
    int ver = -1;
    EXPECT_EQ(xmldb_get_korvadm_ver(&ver), KORV_OK);
    EXPECT_EQ(ver, 0);
    put("/iscsi/acl/count", "0");
    EXPECT_EQ(xmldb_get_korvadm_ver(&ver), KORV_OK);
    EXPECT_EQ(ver, 1);
    EXPECT_EQ(xmldb_set_korvadm_ver(2), KORV_OK);
    EXPECT_EQ(xmldb_get_korvadm_ver(&ver), KORV_OK);
    EXPECT_EQ(ver, 2);
    db().kill();
    EXPECT_EQ(quiet([&] { return xmldb_get_korvadm_ver(&ver); }), ERR_DB_WRITE);
}

using SavedValues = StoreTest;

TEST_F(SavedValues, HostNameNeedsAFullSizedBuffer)
{
    EXPECT_EQ(xmldb_set_saved_host_name("nas-1"), KORV_OK);
    char small[127];
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_get_saved_host_name(small, sizeof small); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("parameter error"), std::string::npos);
    char buf[128];
    std::memset(buf, 'x', sizeof buf);
    EXPECT_EQ(xmldb_get_saved_host_name(buf, sizeof buf), KORV_OK);
    EXPECT_STREQ(buf, "nas-1");
    EXPECT_EQ(xmldb_set_saved_host_name(""), KORV_OK);
    EXPECT_EQ(xmldb_get_saved_host_name(buf, sizeof buf), KORV_OK);
    EXPECT_STREQ(buf, "");
}

TEST_F(SavedValues, IqnPrefixIsEmptyUntilSet)
{
    char buf[CONF_GEN_IQN_LEN] = "junk";
    EXPECT_EQ(xmldb_get_iqn_prefix(buf, sizeof buf), KORV_OK);
    EXPECT_STREQ(buf, "");
    EXPECT_EQ(xmldb_set_iqn_prefix("iqn.2000-01.com.example:"), KORV_OK);
    EXPECT_EQ(xmldb_get_iqn_prefix(buf, sizeof buf), KORV_OK);
    EXPECT_STREQ(buf, "iqn.2000-01.com.example:");
    EXPECT_EQ(quiet([&] { return xmldb_get_iqn_prefix(buf, CONF_GEN_IQN_LEN - 1); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return xmldb_set_iqn_prefix(nullptr); }), ERR_PARAM);
}

TEST_F(SavedValues, AddressesMapInterfacesToTwoSlots)
{
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_set_saved_ipv4_addr("192.0.2.1", "eth0"); }, &out), ERR_NOT_FOUND);
    EXPECT_EQ(raw("/iscsi/target/IP1"), "");
    EXPECT_EQ(raw("/iscsi/target/IP2"), "");
    EXPECT_EQ(xmldb_set_saved_ipv4_addr("192.0.2.1", "bond0"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IP1"), "192.0.2.1");
    EXPECT_EQ(xmldb_set_saved_ipv4_addr("192.0.2.2", "egiga1"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IP2"), "192.0.2.2");
    EXPECT_EQ(xmldb_set_saved_ipv6_addr("2001:db8::1", "egiga0"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IPv6_1"), "2001:db8::1");

    char v4[16];
    char v6[40];
    EXPECT_EQ(xmldb_get_saved_ipv4_addr(v4, "egiga0"), KORV_OK);
    EXPECT_STREQ(v4, "192.0.2.1");
    EXPECT_EQ(xmldb_get_saved_ipv6_addr(v6, "bond0"), KORV_OK);
    EXPECT_STREQ(v6, "2001:db8::1");
    EXPECT_EQ(xmldb_get_saved_ipv6_addr(v6, "egiga1"), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_saved_ipv4_addr(v4, ""); }), ERR_PARAM);
    EXPECT_EQ(quiet([&] { return xmldb_get_saved_ipv4_addr(v4, "lo"); }), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_set_saved_ipv4_addr("", "bond0"); }), ERR_PARAM);

    // A stored value longer than the reader's buffer is cut to it.
    put("/iscsi/target/IP2", "255.255.255.255.255");
    EXPECT_EQ(xmldb_get_saved_ipv4_addr(v4, "egiga1"), KORV_OK);
    EXPECT_EQ(std::strlen(v4), 15u);

    EXPECT_EQ(xmldb_clean_saved_ip_addr(), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IP1"), "");
    EXPECT_EQ(raw("/iscsi/target/IP2"), "");
    EXPECT_EQ(raw("/iscsi/target/IPv6_1"), "2001:db8::1");
}

TEST_F(SavedValues, DebugLevelUnsetReadsZeroWithTheWrappersCode)
{
    int level = 7;
    EXPECT_EQ(xmldb_get_debug_level(&level), ERR_INT_VALUE);
    EXPECT_EQ(level, 0);
    EXPECT_EQ(xmldb_set_debug_level(3), KORV_OK);
    EXPECT_EQ(xmldb_get_debug_level(&level), KORV_OK);
    EXPECT_EQ(level, 3);
    EXPECT_EQ(xmldb_get_debug_level(nullptr), ERR_PARAM);
}

TEST_F(SavedValues, TempReturnCode)
{
    EXPECT_EQ(xmldb_set_temp_return_code(-9980), KORV_OK);
    EXPECT_EQ(raw("/temp/iscsi/return_code"), "-9980");
    db().kill();
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_set_temp_return_code(1); }, &out), ERR_DB_WRITE);
    EXPECT_NE(out.find("xmldb_set_int32_t error, return: -9992"), std::string::npos) << out;
}

using ServiceSwitches = StoreTest;

TEST_F(ServiceSwitches, DaemonPidEnableAndServer)
{
    int v = -1;
    EXPECT_EQ(xmldb_get_nesrad_pid(&v), KORV_OK);
    EXPECT_EQ(v, 0);
    EXPECT_EQ(xmldb_set_nesrad_pid(4242), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/pid"), "4242");
    EXPECT_EQ(xmldb_set_nesrad_pid(0), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/pid"), "0");
    std::string out;
    EXPECT_EQ(quiet([&] { return xmldb_set_nesrad_pid(-1); }, &out), ERR_PARAM);
    EXPECT_NE(out.find("parameter error"), std::string::npos);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/pid"), "0");

    EXPECT_EQ(xmldb_set_nesrad_enable(5), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/enable"), "1");
    EXPECT_EQ(xmldb_get_nesrad_enable(&v), KORV_OK);
    EXPECT_EQ(v, 1);
    EXPECT_EQ(quiet([&] { return xmldb_get_nesrad_enable(nullptr); }), ERR_PARAM);

    char ip[64] = "junk";
    EXPECT_EQ(xmldb_get_nesrad_ip(ip, sizeof ip), KORV_OK);
    EXPECT_STREQ(ip, "");
    EXPECT_EQ(xmldb_set_nesrad_ip("isns.example.com"), KORV_OK);
    EXPECT_EQ(xmldb_get_nesrad_ip(ip, sizeof ip), KORV_OK);
    EXPECT_STREQ(ip, "isns.example.com");
    char tiny[5];
    EXPECT_EQ(xmldb_get_nesrad_ip(tiny, sizeof tiny), KORV_OK);
    EXPECT_STREQ(tiny, "isns");

    EXPECT_EQ(xmldb_clean_nesrad_conf(), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/ip"), "");
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/enable"), "");
}

TEST_F(ServiceSwitches, ServiceEnableAndProgress)
{
    int v = -1;
    EXPECT_EQ(xmldb_get_service_enable(&v), KORV_OK);
    EXPECT_EQ(v, 0);
    EXPECT_EQ(xmldb_set_service_enable(-3), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/enable"), "1");
    EXPECT_EQ(xmldb_get_service_enable(&v), KORV_OK);
    EXPECT_EQ(v, 1);
    EXPECT_EQ(xmldb_set_service_progress(-7), KORV_OK);
    EXPECT_EQ(xmldb_get_service_progress(&v), KORV_OK);
    EXPECT_EQ(v, -7);
}

using WholeStore = StoreTest;

TEST_F(WholeStore, CleanKeepsOnlyTheServiceSwitch)
{
    put("/system_mgr/iscsi/enable", "1");
    put("/system_mgr/iscsi/iSNS/pid", "12");
    put("/iscsi/target/id:1/name", "a");
    put("/iscsi/target/ver", "2");
    put("/iscsi/lun/id:1/name", "l");
    put("/iscsi/acl/count", "1");
    put("/iscsi/sess/initiator/id:1/name", "i");
    put("/network_mgr/lan0/ip", "192.0.2.1");
    EXPECT_EQ(xmldb_clean_conf(), KORV_OK);
    for (const char *gone : {"/system_mgr/iscsi/iSNS/pid", "/iscsi/target/id:1/name", "/iscsi/target/ver",
                             "/iscsi/lun/id:1/name", "/iscsi/acl/count", "/iscsi/sess/initiator/id:1/name"})
        EXPECT_EQ(raw(gone), "") << gone;
    EXPECT_EQ(raw("/system_mgr/iscsi/enable"), "1");
    EXPECT_EQ(raw("/network_mgr/lan0/ip"), "192.0.2.1");
}

TEST_F(WholeStore, SaveWritesTheConfigurationFile)
{
    put("/iscsi/target/id:1/name", "saved-target");
    korv_test::SysRoot::remove("/etc/NAS_CFG/config.xml");
    korv_test::SysRoot::remove("/usr/local/config");
    korv_test::SysRoot::mkdirs("/etc/NAS_CFG");
    korv_test::SysRoot::mkdirs("/usr/local");
    EXPECT_EQ(iscsi_conf_ops.xmldb_save_conf(), 0);
    EXPECT_NE(korv_test::SysRoot::read("/etc/NAS_CFG/config.xml").find("saved-target"), std::string::npos);
    EXPECT_NE(korv_test::SysRoot::read("/usr/local/config/config.xml").find("saved-target"), std::string::npos);

    // Nothing saved and nothing to copy: the copy's failure is the result.
    db().kill();
    korv_test::SysRoot::remove("/etc/NAS_CFG/config.xml");
    EXPECT_NE(quiet([] { return xmldb_save_conf(); }), 0);
}

TEST(OperationsTable, SlotsSitAtTheirFixedPlaces)
{
    // Slot k (1-based) lies k-1 pointers after slot 1.
    auto slot = [](size_t offset) {
        return (offset - offsetof(iscsi_conf_ops_t, xmldb_get_service_enable)) / sizeof(void *) + 1;
    };
    EXPECT_EQ(iscsi_conf_ops.conf_type, 1);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_get_debug_level)), 16u);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_get_target_tpgt)), 27u);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_get_all_target_conf_lite)), 48u);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_update_current_aclcnt)), 96u);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_set_nesrad_pid)), 107u);
    EXPECT_EQ(slot(offsetof(iscsi_conf_ops_t, xmldb_set_target_conn_info)), 119u);

    auto filled = [](int k) {
        uintptr_t v = 0;
        std::memcpy(&v,
                    reinterpret_cast<const char *>(&iscsi_conf_ops) + offsetof(iscsi_conf_ops_t, xmldb_get_service_enable) +
                        (k - 1) * sizeof(void *),
                    sizeof v);
        return v != 0;
    };
    for (int empty : {18, 19, 20, 28, 32, 33, 34, 35, 36, 37, 41, 42, 43, 51, 58, 71, 72, 74, 93, 100, 104})
        EXPECT_FALSE(filled(empty)) << "slot " << empty;
    for (int k = 1; k <= 49; k++) {
        if (k != 18 && k != 19 && k != 20 && k != 28 && !(k >= 32 && k <= 37) && !(k >= 41 && k <= 43)) {
            EXPECT_TRUE(filled(k)) << "slot " << k;
        }
    }
    for (int k = 106; k <= 119; k++) {
        if (k != 114) {
            EXPECT_TRUE(filled(k)) << "slot " << k;
        }
    }
}
