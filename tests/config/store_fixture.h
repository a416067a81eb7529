// SPDX-License-Identifier: Apache-2.0
// A fresh configuration database service per test, with raw access to its
// tree that bypasses the code under test, and the checks the store's tests
// share.
#pragma once

#include <cstdio>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <type_traits>

#include <gtest/gtest.h>

#include "common/korvadm_err.h"
#include "common/korvadm_list.h"
#include "common/korvadm_log.h"
#include "common/korvadm_str.h"
#include "config/korvadm_conf.h"
#include "config/korvadm_xmldb_conf.h"
#include "config/korvadm_xmldb_conf_internal.h"
#include "platform/xmldbc.h"
#include "tests/support/process.h"
#include "tests/support/xmldbd_fixture.h"

namespace korv_test {

// A sample database tree under tests/config/data.
inline std::string data_file(const char *name) { return std::string(KORV_TEST_DATA) + "/" + name; }

// A data file's lines without comments.
inline std::string data(const char *name)
{
    std::ifstream in(data_file(name));
    std::string out;
    for (std::string l; std::getline(in, l);)
        if (!l.empty() && l[0] != '#')
            out += l + "\n";
    return out;
}

// The "path = value" lines of the subtree at path, in the store's order, of
// the service on sock (a system path).
inline std::string dump(const std::string &path, const std::string &sock = XMLDB_SOCK_ISCSI)
{
    std::string out;
    korv::read_command_lines((xmldbc_binary() + " -s " + sock + " dump " + path).c_str(), [&](std::string_view l) {
        if (l.find(" = ") != std::string_view::npos)
            out.append(l).append("\n");
        return true;
    });
    return out;
}

// "<root>/id:<n>/<field>"
inline std::string epath(const std::string &root, int n, const std::string &field)
{
    return root + "/id:" + std::to_string(n) + "/" + field;
}

// Values joined with "/", numbers in decimal.
template <class T>
std::string text(const T &v)
{
    if constexpr (std::is_convertible_v<const T &, std::string>)
        return std::string(v);
    else
        return std::to_string(v);
}
template <class... A>
std::string slash(const A &...a)
{
    std::string out;
    ((out += "/" + text(a)), ...);
    return out.substr(1);
}

// fn()'s result, run quietly; its log must hold message.
template <class Fn>
auto logged(Fn fn, const std::string &message)
{
    std::string out;
    auto rc = quiet(fn, &out);
    EXPECT_NE(out.find(message), std::string::npos) << "wanted: " << message << "\n" << out;
    return rc;
}

// One record as text, per kind.
inline std::string show(const target_conf_t *t) { return slash(t->name, t->tpgt, t->dbidx); }
inline std::string show(const lun_conf_t *l) { return slash(l->name, l->devid, l->dbidx); }
inline std::string show(const target_map_lun_conf_t *m) { return slash(m->target_name, m->lun_name, m->lun_num); }
inline std::string show(const acl_initiator_conf_t *a) { return slash(a->initiator, a->alias, a->dbidx); }
inline std::string show(const lun_acl_conf_t *a) { return slash(a->initiator, a->alias, a->access_right); }

// The records a list reader hands out, shown and separated by spaces; the
// reader must answer want. Its log goes to *log when given.
template <class T>
std::string records(const std::function<int(list_t *)> &read, void (*free_list)(list_t *), int want = KORV_OK,
                    std::string *log = nullptr)
{
    korv::list_owner list(free_list);
    EXPECT_EQ(quiet([&] { return read(list.get()); }, log), want);
    std::string out;
    for (const T *r : korv::list_records<T>(list.get()))
        out += (out.empty() ? "" : " ") + show(r);
    return out;
}

// Valid records, as the management tool fills them.
using target_ptr = std::unique_ptr<target_conf_t, void (*)(target_conf_t *)>;
using lun_ptr = std::unique_ptr<lun_conf_t, void (*)(lun_conf_t *)>;
inline target_ptr new_target(const std::string &name, int chap = 0)
{
    target_ptr t(target_conf_new(), target_conf_free);
    std::snprintf(t->name, sizeof t->name, "%s", name.c_str());
    std::snprintf(t->iqn, sizeof t->iqn, "iqn.2000-01.com.example:%s", name.c_str());
    t->tpgt = 1;
    t->state = t->hba_id = 0;
    t->chap_enable = chap;
    std::snprintf(t->chap_name, sizeof t->chap_name, "user");
    std::snprintf(t->chap_pwd, sizeof t->chap_pwd, "secret12345678");
    return t;
}
inline lun_ptr new_lun(const std::string &name, uint64_t size = 4096)
{
    lun_ptr l(lun_conf_new(), lun_conf_free);
    std::snprintf(l->name, sizeof l->name, "%s", name.c_str());
    std::snprintf(l->uuid, sizeof l->uuid, "vol-%s", name.c_str());
    std::snprintf(l->serial, sizeof l->serial, "sn-%s", name.c_str());
    std::snprintf(l->img_file, sizeof l->img_file, "/mnt/v/%s.img", name.c_str());
    l->size = size;
    l->devid = 3;
    l->prealloc = 1;
    return l;
}

class StoreTest : public ::testing::Test {
protected:
    // The service starts with an empty tree, or with the tree of load_file.
    explicit StoreTest(std::string load_file = {}) : db_(false, std::move(load_file)) {}

    // Raw value at path ("" when absent, "<failed>" when the service does not answer).
    static std::string raw(const std::string &path) { return xmldb_get(path); }
    static void put(const std::string &path, const std::string &value)
    {
        ASSERT_EQ(xmldbc_set(XMLDB_SOCK_ISCSI, 0, path.c_str(), value.c_str()), 0) << path;
    }
    static std::string tpath(int id, const char *field) { return epath("/iscsi/target", id, field); }
    static std::string lpath(int id, const char *field) { return epath("/iscsi/lun", id, field); }

    XmldbService &db() { return db_; }

private:
    XmldbService db_;  // one fresh service per test
};

// A store that starts with the tree of a data file: LoadedStore<kName>.
template <const char *File>
class LoadedStore : public StoreTest {
protected:
    LoadedStore() : StoreTest(data_file(File)) {}
};
// data/unmapped.xml: targets t1 and t2, LUNs l1 to l4.
inline constexpr char kUnmapped[] = "unmapped.xml";
using SampleStore = LoadedStore<kUnmapped>;

}  // namespace korv_test
