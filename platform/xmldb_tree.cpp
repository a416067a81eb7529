// SPDX-License-Identifier: Apache-2.0
// The in-memory tree of xmldbd, its text dump and its XML file form.
#include "platform/xmldb_tree.h"

#include <algorithm>
#include <cstring>
#include <pugixml.hpp>

namespace xmldb {

namespace {

// Calls fn for each non-empty segment; stops early when fn returns false.
template <typename Fn>
bool for_each_segment(std::string_view path, Fn fn)
{
    size_t i = 0;
    while (i < path.size()) {
        size_t j = path.find('/', i);
        if (j == std::string_view::npos)
            j = path.size();
        if (j > i && !fn(path.substr(i, j - i)))
            return false;
        i = j + 1;
    }
    return true;
}

bool is_plain_xml_name(std::string_view s)
{
    if (s.empty() || s == "node")
        return false;
    auto alpha = [](char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_'; };
    if (!alpha(s[0]))
        return false;
    if (s.size() >= 3 && (s[0] | 0x20) == 'x' && (s[1] | 0x20) == 'm' && (s[2] | 0x20) == 'l')
        return false;  // names starting with "xml" are reserved
    return std::all_of(s.begin(), s.end(), [&](char c) {
        return alpha(c) || (c >= '0' && c <= '9') || c == '-' || c == '.';
    });
}

// Out is a std::string, or a Counter when only the size is wanted.
struct Counter {
    size_t n = 0;
    Counter &operator+=(std::string_view s) { n += s.size(); return *this; }
    Counter &operator+=(char) { ++n; return *this; }
};

template <class Out>
void escape_into(Out &out, std::string_view v)
{
    static const char hex[] = "0123456789abcdef";
    size_t plain = 0;  // start of the run of bytes that go out as they are
    for (size_t i = 0; i < v.size(); ++i) {
        auto u = static_cast<unsigned char>(v[i]);
        if (u >= 0x20 && u != 0x7f && u != '\\')
            continue;
        out += v.substr(plain, i - plain);
        plain = i + 1;
        switch (u) {
        case '\\': out += "\\\\"; break;
        case '\n': out += "\\n"; break;
        case '\r': out += "\\r"; break;
        case '\t': out += "\\t"; break;
        default:
            out += "\\x";
            out += hex[u >> 4];
            out += hex[u & 15];
        }
    }
    out += v.substr(plain);
}

template <class Out>
void dump_node(Out &out, std::string &path, const Tree::Node &n)
{
    out += path.empty() ? std::string_view("/") : std::string_view(path);
    if (!n.value.empty()) {
        out += " = ";
        escape_into(out, n.value);
    }
    out += '\n';
    for (const auto &k : n.kids) {
        size_t len = path.size();
        path += '/';
        path += k.name;
        dump_node(out, path, k);
        path.resize(len);
    }
}

void to_element(pugi::xml_node parent, const Tree::Node &n)
{
    pugi::xml_node e;
    if (is_plain_xml_name(n.name)) {
        e = parent.append_child(n.name.c_str());
    } else {
        e = parent.append_child("node");
        e.append_attribute("name").set_value(n.name.c_str());
    }
    if (!n.value.empty())
        e.append_attribute("value").set_value(n.value.c_str());
    for (const auto &k : n.kids)
        to_element(e, k);
}

bool from_element(pugi::xml_node e, Tree::Node &into, size_t depth, std::string &err)
{
    for (pugi::xml_node c = e.first_child(); c; c = c.next_sibling()) {
        if (c.type() != pugi::node_element)
            continue;
        if (depth > kDepthMax) {
            err = "nesting deeper than " + std::to_string(kDepthMax) + " levels";
            return false;
        }
        std::string_view name = c.name();
        if (name == "node") {
            pugi::xml_attribute a = c.attribute("name");
            if (!a) {
                err = "a <node> element without a name attribute";
                return false;
            }
            name = a.value();
        }
        if (name.empty() || name.find('/') != std::string_view::npos) {
            err = "bad node name \"" + std::string(name) + "\"";
            return false;
        }
        Tree::Node *k = into.find(name);
        if (!k) {
            into.kids.push_back(Tree::Node{std::string(name), {}, {}});
            k = &into.kids.back();
        }
        if (pugi::xml_attribute v = c.attribute("value"))
            k->value = v.value();
        if (!from_element(c, *k, depth + 1, err))
            return false;
    }
    return true;
}

size_t count_nodes(const Tree::Node &n)
{
    size_t c = 1;
    for (const auto &k : n.kids)
        c += count_nodes(k);
    return c;
}

struct StringWriter : pugi::xml_writer {
    std::string out;
    void write(const void *data, size_t size) override { out.append(static_cast<const char *>(data), size); }
};

}  // namespace

Tree::Node *Tree::Node::find(std::string_view n)
{
    for (auto &k : kids)
        if (k.name == n)
            return &k;
    return nullptr;
}

const Tree::Node *Tree::Node::find(std::string_view n) const
{
    return const_cast<Node *>(this)->find(n);
}

const Tree::Node *Tree::lookup(std::string_view path) const
{
    const Node *cur = &root_;
    for_each_segment(path, [&](std::string_view seg) {
        cur = cur->find(seg);
        return cur != nullptr;
    });
    return cur;
}

std::string_view Tree::get(std::string_view path) const
{
    const Node *n = lookup(path);
    return n ? std::string_view(n->value) : std::string_view();
}

bool Tree::set(std::string_view path, std::string_view value)
{
    size_t depth = 0;
    for_each_segment(path, [&](std::string_view) { return ++depth <= kDepthMax; });
    if (depth == 0 || depth > kDepthMax)
        return false;
    Node *cur = &root_;
    for_each_segment(path, [&](std::string_view seg) {
        Node *k = cur->find(seg);
        if (!k) {
            cur->kids.push_back(Node{std::string(seg), {}, {}});
            k = &cur->kids.back();
        }
        cur = k;
        return true;
    });
    cur->value.assign(value);
    return true;
}

void Tree::del(std::string_view path)
{
    Node *parent = nullptr;
    Node *cur = &root_;
    for_each_segment(path, [&](std::string_view seg) {
        parent = cur;
        cur = cur->find(seg);
        return cur != nullptr;
    });
    if (!cur)
        return;
    if (!parent) {
        root_ = Node{};
        return;
    }
    auto &kids = parent->kids;
    kids.erase(kids.begin() + (cur - kids.data()));
}

template <class Out>
void Tree::dump_as(std::string_view path, Out &out) const
{
    const Node *n = lookup(path);
    if (!n)
        return;
    std::string p;
    for_each_segment(path, [&](std::string_view seg) {
        p += '/';
        p += seg;
        return true;
    });
    dump_node(out, p, *n);
}

void Tree::dump(std::string_view path, std::string &out) const
{
    dump_as(path, out);
}

size_t Tree::dump_size(std::string_view path) const
{
    Counter c;
    dump_as(path, c);
    return c.n;
}

std::string Tree::to_xml() const
{
    pugi::xml_document doc;
    auto decl = doc.append_child(pugi::node_declaration);
    decl.append_attribute("version").set_value("1.0");
    decl.append_attribute("encoding").set_value("UTF-8");
    pugi::xml_node top = doc.append_child("xmldb");
    top.append_attribute("version").set_value("1");
    for (const auto &k : root_.kids)
        to_element(top, k);
    StringWriter w;
    doc.save(w, "  ", pugi::format_indent, pugi::encoding_utf8);
    return std::move(w.out);
}

bool Tree::from_xml(std::string_view text, std::string &err)
{
    pugi::xml_document doc;
    // No whitespace or line-end normalisation: values load byte for byte.
    pugi::xml_parse_result r = doc.load_buffer(text.data(), text.size(),
                                               pugi::parse_cdata | pugi::parse_escapes,
                                               pugi::encoding_utf8);
    if (!r) {
        err = std::string(r.description()) + " at byte " + std::to_string(r.offset);
        return false;
    }
    pugi::xml_node top = doc.document_element();
    if (std::strcmp(top.name(), "xmldb") != 0) {
        err = "root element is not <xmldb>";
        return false;
    }
    Node fresh;
    if (!from_element(top, fresh, 1, err))
        return false;
    root_ = std::move(fresh);
    return true;
}

size_t Tree::node_count() const
{
    return count_nodes(root_) - 1;
}

}  // namespace xmldb
