// The service's tree on its own: paths, dumps and the XML file form.
#include "platform/xmldb_tree.h"

#include <gtest/gtest.h>
#include <string>
#include <vector>

using xmldb::Tree;

namespace {

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
    // Insertion order, control bytes escaped.
    EXPECT_EQ(t.dump("/"), "/\n/z\n/z/b = 1\n/a = line\\nnext\\ttab\\\\ \\x01\n");
    EXPECT_EQ(t.dump("/missing"), "");
    EXPECT_FALSE(t.set("/", "x"));
    EXPECT_FALSE(t.set("", "x"));
    t.del("/");
    EXPECT_EQ(t.node_count(), 0u);

    std::string deep;
    for (size_t i = 0; i < xmldb::kDepthMax; ++i)
        deep += "/d";
    EXPECT_TRUE(t.set(deep, "bottom"));
    EXPECT_FALSE(t.set(deep + "/d", "too deep"));
    EXPECT_EQ(round_trip(t).get(deep), "bottom");
}

TEST(XmldbFormat, AwkwardNamesAndValuesRoundTrip)
{
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"/iscsi/target/id:1/name", "iqn.2004-04.com.example:tgt-1"},
        {"/iscsi/target/id:1/empty", ""},
        {"/blanks/lead", "  two leading, two trailing  "},
        {"/blanks/only", "   "},
        {"/quotes", "say \"hi\" and 'bye'"},
        {"/angles", "<b>&amp; not markup</b>"},
        {"/lines", "one\r\ntwo\nthree\ttab"},
        {"/utf8/caf\xc3\xa9", "gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x92\xbe"},
        {"/raw", "\xff\xfe bytes"},
        {"/node", "a segment called node"},
        {"/xml-reserved", "names starting with xml"},
        {"/9starts-with-digit", "v"},
        {"/has space/and\"quote", "v"},
        {"/a<b>&c", "v"},
        {"/control\x02name", "ctl"},
        {"/dot.dash-under_score", "plain"},
    };
    Tree t;
    for (const auto &[p, v] : cases)
        ASSERT_TRUE(t.set(p, v)) << p;
    Tree back = round_trip(t);
    for (const auto &[p, v] : cases)
        EXPECT_EQ(back.get(p), v) << p;
    EXPECT_EQ(back.dump("/"), t.dump("/"));  // same nodes, same order
    EXPECT_EQ(back.to_xml(), t.to_xml());
}

TEST(XmldbFormat, FileIsOneReadableElementPerNode)
{
    Tree t;
    t.set("/iscsi/target/count", "1");
    t.set("/iscsi/target/id:1/name", "tgt");
    EXPECT_EQ(t.to_xml(),
              "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
              "<xmldb version=\"1\">\n"
              "  <iscsi>\n"
              "    <target>\n"
              "      <count value=\"1\" />\n"
              "      <node name=\"id:1\">\n"
              "        <name value=\"tgt\" />\n"
              "      </node>\n"
              "    </target>\n"
              "  </iscsi>\n"
              "</xmldb>\n");
}

TEST(XmldbFormat, HandWrittenFilesLoadAndBadOnesKeepTheTree)
{
    // What an operator might write: comments, no declaration, duplicate
    // elements merged, other attributes ignored.
    Tree t;
    std::string err;
    ASSERT_TRUE(t.from_xml("<!-- factory defaults -->\n<xmldb>\n"
                           "  <system_mgr><iscsi><enable value=\"1\"/></iscsi></system_mgr>\n"
                           "  <system_mgr><iscsi><progress value=\"0\" note=\"x\"/></iscsi></system_mgr>\n"
                           "</xmldb>\n",
                           err))
        << err;
    EXPECT_EQ(t.get("/system_mgr/iscsi/enable"), "1");
    EXPECT_EQ(t.node_count(), 4u);

    std::string nested = "<xmldb>";
    for (size_t i = 0; i < xmldb::kDepthMax + 5; ++i)
        nested += "<d>";
    for (size_t i = 0; i < xmldb::kDepthMax + 5; ++i)
        nested += "</d>";
    const std::vector<std::string> bad = {
        "",
        "<xmldb><system_mgr value=\"1\">",              // torn
        "<other/>",                                       // wrong root
        "<xmldb><node value=\"no name\"/></xmldb>",       // <node> without name
        "<xmldb><node name=\"\"/></xmldb>",               // empty name
        "<xmldb><node name=\"a/b\"/></xmldb>",            // slash inside a name
        "not xml at all",
        nested + "</xmldb>",
    };
    for (const auto &doc : bad) {
        err.clear();
        EXPECT_FALSE(t.from_xml(doc, err)) << doc;
        EXPECT_FALSE(err.empty()) << doc;
        EXPECT_EQ(t.get("/system_mgr/iscsi/enable"), "1") << doc;
    }
}
