// SPDX-License-Identifier: Apache-2.0
/* The configuration database tree held by xmldbd, and its XML file form.
 *
 * A tree of text values addressed by slash-separated paths. Each segment is
 * an opaque name ("id:3" is a name, not a position); empty segments are
 * ignored, so "/a//b/" is "/a/b". A missing node and an empty value read the
 * same; set creates every missing parent; delete removes a whole subtree and
 * succeeds when nothing is there. Children keep the order they were created
 * in, which is also the order of the XML file and of dumps.
 *
 * XML form (docs/xmldb.md): root element <xmldb version="1">, one element per
 * node, the value in a "value" attribute (absent for empty). A segment that is
 * a plain XML name is the element's name; any other segment (and "node"
 * itself) is written <node name="...">. */
#ifndef PLATFORM_XMLDB_TREE_H
#define PLATFORM_XMLDB_TREE_H

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace xmldb {

// Deepest node a path or a file may hold (a path of single-letter segments).
inline constexpr size_t kDepthMax = 2048;

class Tree {
public:
    // The value at path; empty for a missing node.
    std::string_view get(std::string_view path) const;
    // Stores value, creating parents. False for the root or a too deep path.
    bool set(std::string_view path, std::string_view value);
    // Removes path and its subtree ("/" empties the tree).
    void del(std::string_view path);
    // The subtree at path as text lines "<path> = <value>" (just "<path>" when
    // empty), parents before children; control bytes and '\' escaped C-style.
    std::string dump(std::string_view path) const
    {
        std::string out;
        dump(path, out);
        return out;
    }
    // The same, appended to out; dump_size says how long it will be without
    // building it.
    void dump(std::string_view path, std::string &out) const;
    size_t dump_size(std::string_view path) const;

    // The whole tree as an XML document.
    std::string to_xml() const;
    // Replaces the tree with the document's. On failure the tree is unchanged
    // and err says why.
    bool from_xml(std::string_view text, std::string &err);

    size_t node_count() const;

    struct Node {
        std::string name;
        std::string value;
        std::vector<Node> kids;
        Node *find(std::string_view n);
        const Node *find(std::string_view n) const;
    };

private:
    template <class Out>
    void dump_as(std::string_view path, Out &out) const;
    const Node *lookup(std::string_view path) const;
    Node root_;
};

}  // namespace xmldb

#endif
