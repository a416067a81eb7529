// SPDX-License-Identifier: Apache-2.0
// A fresh configuration database service per test, with raw access to its
// tree that bypasses the code under test.
#pragma once

#include <string>

#include <gtest/gtest.h>

#include "platform/xmldbc.h"
#include "tests/support/capture.h"
#include "tests/support/xmldbd_fixture.h"

namespace korv_test {

// A sample database tree under tests/config/data.
inline std::string data_file(const char *name)
{
    return std::string(KORV_CONFIG_DATA) + "/" + name;
}

class StoreTest : public ::testing::Test {
protected:
    // The service starts with an empty tree, or with the tree of load_file.
    explicit StoreTest(std::string load_file = {}) : db_(false, std::move(load_file)) {}

    // Raw value at path ("" when absent); fails the test when the service does not answer.
    static std::string raw(const std::string &path)
    {
        char buf[4096] = "";
        EXPECT_GE(xmldbc_get_wb(XMLDB_SOCK_ISCSI, 0, path.c_str(), buf, sizeof buf), 0) << path;
        return buf;
    }
    static void put(const std::string &path, const std::string &value)
    {
        ASSERT_EQ(xmldbc_set(XMLDB_SOCK_ISCSI, 0, path.c_str(), value.c_str()), 0) << path;
    }
    static std::string tpath(int id, const char *field)
    {
        return "/iscsi/target/id:" + std::to_string(id) + "/" + field;
    }
    // Writes a target entry directly, as another writer of the store would.
    static void put_target(int id, const std::string &name, int tpgt = 1, int hba_id = 0)
    {
        put(tpath(id, "name"), name);
        put(tpath(id, "iqn"), "iqn.2000-01.com.example:" + name);
        put(tpath(id, "tpgt"), std::to_string(tpgt));
        put(tpath(id, "hba_id"), std::to_string(hba_id));
        put(tpath(id, "state"), "0");
        put(tpath(id, "chap_enable"), "0");
    }

    XmldbService &db() { return db_; }

private:
    XmldbService db_;  // one fresh service per test
};

}  // namespace korv_test
