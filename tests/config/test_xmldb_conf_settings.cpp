// SPDX-License-Identifier: Apache-2.0
// Service settings, versions, saved names and addresses, the whole-store
// operations, and the operations table's shape.
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "tests/config/store_fixture.h"

using namespace korv_test;

using Settings = StoreTest;

TEST_F(Settings, VersionFallsBackToTheAclCounterThenToZero)
{
    int ver = -1;
    EXPECT_EQ(slash(xmldb_get_korvadm_ver(&ver), ver), "0/0");
    put("/iscsi/acl/count", "0");
    EXPECT_EQ(slash(xmldb_get_korvadm_ver(&ver), ver), "0/1");
    EXPECT_EQ(xmldb_set_korvadm_ver(2), KORV_OK);
    EXPECT_EQ(slash(xmldb_get_korvadm_ver(&ver), ver), "0/2");
    db().kill();
    EXPECT_EQ(quiet([&] { return xmldb_get_korvadm_ver(&ver); }), ERR_DB_WRITE);
}

TEST_F(Settings, HostNameAndIqnPrefixNeedFullSizedBuffers)
{
    EXPECT_EQ(xmldb_set_saved_host_name("nas-1"), KORV_OK);
    char buf[CONF_GEN_IQN_LEN] = "junk";
    EXPECT_EQ(logged([&] { return xmldb_get_saved_host_name(buf, 127); }, "parameter error"), ERR_PARAM);
    EXPECT_EQ(slash(xmldb_get_saved_host_name(buf, 128), buf), "0/nas-1");

    // An unset prefix reads as empty: checked through the generated names.
    EXPECT_EQ(xmldb_set_iqn_prefix("iqn.2000-01.com.example:"), KORV_OK);
    EXPECT_EQ(slash(xmldb_get_iqn_prefix(buf, sizeof buf), buf), "0/iqn.2000-01.com.example:");
    EXPECT_EQ(quiet([&] { return xmldb_get_iqn_prefix(buf, CONF_GEN_IQN_LEN - 1); }), ERR_PARAM);
}

TEST_F(Settings, AddressesMapInterfacesToTwoSlots)
{
    EXPECT_EQ(quiet([&] { return xmldb_set_saved_ipv4_addr("192.0.2.1", "eth0"); }), ERR_NOT_FOUND);
    EXPECT_EQ(xmldb_set_saved_ipv4_addr("192.0.2.1", "bond0"), KORV_OK);
    EXPECT_EQ(xmldb_set_saved_ipv4_addr("192.0.2.2", "egiga1"), KORV_OK);
    EXPECT_EQ(xmldb_set_saved_ipv6_addr("2001:db8::1", "egiga0"), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IP1") + " " + raw("/iscsi/target/IP2") + " " + raw("/iscsi/target/IPv6_1"),
              "192.0.2.1 192.0.2.2 2001:db8::1");

    char v4[16], v6[40];
    EXPECT_EQ(slash(xmldb_get_saved_ipv4_addr(v4, "egiga0"), v4, xmldb_get_saved_ipv6_addr(v6, "bond0"), v6),
              "0/192.0.2.1/0/2001:db8::1");
    EXPECT_EQ(xmldb_get_saved_ipv6_addr(v6, "egiga1"), ERR_NOT_FOUND);
    EXPECT_EQ(quiet([&] { return xmldb_get_saved_ipv4_addr(v4, ""); }), ERR_PARAM);
    // A stored value longer than the reader's buffer is cut to it.
    put("/iscsi/target/IP2", "255.255.255.255.255");
    EXPECT_EQ(slash(xmldb_get_saved_ipv4_addr(v4, "egiga1"), v4), "0/255.255.255.255");

    EXPECT_EQ(xmldb_clean_saved_ip_addr(), KORV_OK);
    EXPECT_EQ(raw("/iscsi/target/IP1") + raw("/iscsi/target/IP2") + raw("/iscsi/target/IPv6_1"), "2001:db8::1");
}

TEST_F(Settings, ServiceAndDaemonSwitchesAndTheTempReturnCode)
{
    // The daemon's pid and the switches' reading are checked by the daemon's
    // and the control interface's suites.
    EXPECT_EQ(xmldb_set_service_enable(-3) + xmldb_set_nesrad_enable(5), KORV_OK);
    EXPECT_EQ(xmldb_set_service_progress(-7) + xmldb_set_nesrad_pid(4242), KORV_OK);
    EXPECT_EQ(quiet([&] { return xmldb_set_nesrad_pid(-1); }), ERR_PARAM);
    EXPECT_EQ(raw("/system_mgr/iscsi/enable") + raw("/system_mgr/iscsi/iSNS/enable") +
                  raw("/system_mgr/iscsi/iSNS/pid"),
              "114242");
    int progress = 0;
    EXPECT_EQ(slash(xmldb_get_service_progress(&progress), progress), "0/-7");
    EXPECT_EQ(quiet([&] { return xmldb_get_nesrad_enable(nullptr); }), ERR_PARAM);
    char ip[5] = "junk";
    EXPECT_EQ(xmldb_set_nesrad_ip("isns.example.com"), KORV_OK);
    EXPECT_EQ(slash(xmldb_get_nesrad_ip(ip, sizeof ip), ip), "0/isns");
    EXPECT_EQ(xmldb_clean_nesrad_conf(), KORV_OK);
    EXPECT_EQ(raw("/system_mgr/iscsi/iSNS/ip") + raw("/system_mgr/iscsi/iSNS/enable"), "");

    EXPECT_EQ(xmldb_set_temp_return_code(-9980), KORV_OK);
    EXPECT_EQ(raw("/temp/iscsi/return_code"), "-9980");
    db().kill();
    EXPECT_EQ(logged([&] { return xmldb_set_temp_return_code(1); }, "xmldb_set_int32_t error, return: -9992"),
              ERR_DB_WRITE);
}

constexpr char kWhole[] = "whole_store.xml";
using WholeStore = LoadedStore<kWhole>;

TEST_F(WholeStore, CleanKeepsOnlyTheServiceSwitch)
{
    EXPECT_EQ(xmldb_clean_conf(), KORV_OK);
    EXPECT_EQ(dump("/"), data("whole_store_cleaned.txt"));
}

TEST_F(WholeStore, SaveWritesTheConfigurationFile)
{
    SysRoot::remove("/etc/NAS_CFG/config.xml");
    SysRoot::remove("/usr/local/config");
    SysRoot::mkdirs("/etc/NAS_CFG");
    SysRoot::mkdirs("/usr/local");
    EXPECT_EQ(iscsi_conf_ops.xmldb_save_conf(), 0);
    EXPECT_NE(SysRoot::read("/etc/NAS_CFG/config.xml").find("saved-target"), std::string::npos);
    EXPECT_NE(SysRoot::read("/usr/local/config/config.xml").find("saved-target"), std::string::npos);

    // With the service down nothing is written, and the old file must not
    // reach flash as if it were the new one.
    SysRoot::remove("/usr/local/config");
    db().kill();
    EXPECT_EQ(quiet([] { return xmldb_save_conf(); }), ERR_DB_WRITE);
    EXPECT_EQ(SysRoot::read("/usr/local/config/config.xml"), "");
}

TEST(OperationsTable, OnlyTheProvidedSlotsAreSet)
{
    // Slot k (1-based) lies k-1 pointers after slot 1; the layout itself is
    // pinned at compile time next to the table.
    const char *first = reinterpret_cast<const char *>(&iscsi_conf_ops.xmldb_get_service_enable);
    EXPECT_EQ(iscsi_conf_ops.conf_type, 1);
    const int provided[][2] = {{1, 17},  {21, 27}, {29, 31},  {38, 40},   {44, 50},   {52, 57},
                               {59, 70}, {73, 73}, {75, 92},  {94, 99},   {101, 103}, {105, 119}};
    for (int k = 1, r = 0; k <= 119; k++) {
        uintptr_t v = 0;
        std::memcpy(&v, first + (k - 1) * sizeof(void *), sizeof v);
        r += k > provided[r][1];
        EXPECT_EQ(v != 0, k >= provided[r][0]) << "slot " << k;
    }
}
