// SPDX-License-Identifier: Apache-2.0
// The service's tree on its own: paths, dumps and the XML file form.
#include "platform/xmldb_tree.h"

#include <filesystem>
#include <gtest/gtest.h>

#include "tests/support/sysroot.h"

using xmldb::Tree;

namespace {

// A sample file of tests/platform/data.
std::string sample(const std::string &name) { return korv_test::SysRootTest::read_file(KORV_TEST_DATA "/" + name); }

// Saves and loads back into a fresh tree.
Tree round_trip(const Tree &t)
{
    Tree back;
    std::string err;
    EXPECT_TRUE(back.from_xml(t.to_xml(), err)) << err << "\n" << t.to_xml();
    return back;
}

}  // namespace

TEST(XmldbTree, PathsDumpsAndLimits)
{
    Tree t;
    ASSERT_TRUE(t.set("//z///b/", "1"));  // empty segments are ignored
    t.set("/a", "line\nnext\ttab\\ \x01");
    EXPECT_EQ(t.get("/z/b"), "1");
    // Insertion order, control bytes escaped; the size announced before a
    // dump is built is the size it gets.
    EXPECT_EQ(t.dump("/"), "/\n/z\n/z/b = 1\n/a = line\\nnext\\ttab\\\\ \\x01\n");
    EXPECT_EQ(t.dump_size("/"), t.dump("/").size());
    EXPECT_EQ(t.dump("/missing"), "");
    EXPECT_EQ(t.dump_size("/missing"), 0u);
    EXPECT_FALSE(t.set("/", "x"));
    EXPECT_FALSE(t.set("", "x"));
    ASSERT_TRUE(t.set("/t/id:2/name", "two") && t.set("/t/id:3/name", "three") && t.set("/t", "parent"));
    EXPECT_EQ(t.get("/t/id:2/name"), "two");  // giving a parent a value keeps its children
    t.del("/t/id:2");  // "id:N" is a name, not a position
    t.del("/never/was");
    EXPECT_EQ(t.get("/t/id:2/name"), "");
    EXPECT_EQ(t.get("/t/id:3/name"), "three");
    t.del("/");
    EXPECT_EQ(t.node_count(), 0u);

    std::string deep;
    for (size_t i = 0; i < xmldb::kDepthMax; ++i)
        deep += "/d";
    EXPECT_TRUE(t.set(deep, "bottom"));
    EXPECT_FALSE(t.set(deep + "/d", "too deep"));
    EXPECT_EQ(round_trip(t).get(deep), "bottom");
}

// Blanks, quotes, markup, line ends, control bytes, UTF-8 and raw bytes, names
// that are no XML names: the file shows them as saved, the dump as loaded.
TEST(XmldbFormat, AwkwardNamesAndValuesRoundTripAndBadFilesKeepTheTree)
{
    Tree t;
    std::string err;
    ASSERT_TRUE(t.from_xml(sample("awkward.xml"), err)) << err;
    EXPECT_EQ(t.dump("/"), sample("awkward.dump"));
    EXPECT_EQ(t.dump_size("/"), t.dump("/").size());
    EXPECT_EQ(t.to_xml(), sample("awkward.xml"));
    EXPECT_EQ(round_trip(t).dump("/"), t.dump("/"));

    ASSERT_TRUE(t.from_xml(sample("hand_written.xml"), err)) << err;
    EXPECT_EQ(t.get("/system_mgr/iscsi/enable"), "1");
    EXPECT_EQ(t.node_count(), 4u);

    // Files that do not load as a whole, each with a name that says why.
    int refused = 0;
    for (const auto &bad : std::filesystem::directory_iterator(std::string(KORV_TEST_DATA) + "/refused")) {
        err.clear();
        EXPECT_FALSE(t.from_xml(korv_test::SysRootTest::read_file(bad.path()), err)) << bad.path();
        EXPECT_FALSE(err.empty()) << bad.path();
        EXPECT_EQ(t.get("/system_mgr/iscsi/enable"), "1") << bad.path();
        ++refused;
    }
    EXPECT_EQ(refused, 8);
}
