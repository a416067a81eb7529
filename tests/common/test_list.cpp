// SPDX-License-Identifier: Apache-2.0
// The intrusive list: linking, unlinking and releasing records, and the C++
// range, search and all-or-nothing helpers.
#include "common/korvadm_list.h"

#include <vector>

#include <gtest/gtest.h>

namespace {

struct rec_t {
    int key;
    list_node_t node;
};

int g_freed = 0;

rec_t *rec_new(int key)
{
    auto *r = new rec_t{key, {}};
    list_node_init(&r->node, r);
    return r;
}

void rec_free(void *p)
{
    auto *r = static_cast<rec_t *>(p);
    list_remove(&r->node);
    ++g_freed;
    delete r;
}

// The keys in order, once every link both ways, the ends and the count agree.
std::vector<int> keys(const list_t &l)
{
    std::vector<int> out;
    const list_node_t *prev = nullptr;
    for (const list_node_t *n = l.head; n; prev = n, n = list_next(n)) {
        EXPECT_TRUE(n->prev == prev && n->list == &l) << "links of node " << out.size();
        out.push_back(static_cast<rec_t *>(n->owner)->key);
    }
    EXPECT_TRUE(l.tail == prev && l.count == static_cast<int>(out.size())) << "tail or count";
    EXPECT_EQ(list_is_empty(&l) != 0, out.empty());
    return out;
}

class ListTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        list_init(&list);
        g_freed = 0;
    }
    void TearDown() override { list_release(&list, rec_free); }
    rec_t *add(int key)
    {
        rec_t *r = rec_new(key);
        list_append(&r->node, &list);
        return r;
    }
    list_t list;
};

TEST_F(ListTest, RemovingAnywhereKeepsEveryLinkAndARemovedNodeIsClean)
{
    rec_t *r[4] = {add(0), add(1), add(2), add(3)};
    EXPECT_EQ(keys(list), (std::vector<int>{0, 1, 2, 3}));
    // middle, head, tail, then the only one: null, null, 0
    const std::pair<int, std::vector<int>> steps[] = {{1, {0, 2, 3}}, {0, {2, 3}}, {3, {2}}, {2, {}}};
    for (const auto &[i, left] : steps) {
        list_remove(&r[i]->node);
        EXPECT_EQ(keys(list), left) << "after removing " << i;
        EXPECT_TRUE(!r[i]->node.list && !r[i]->node.next && !r[i]->node.prev) << i;
    }
    list_append(&r[1]->node, &list);
    EXPECT_EQ(keys(list), (std::vector<int>{1}));
    for (int i : {0, 2, 3})
        rec_free(r[i]);
}

TEST_F(ListTest, NullUnlinkedAndEmptyChangeNothing)
{
    add(1);
    rec_t *b = rec_new(2);
    list_remove(&b->node);  // never linked
    list_remove(nullptr);
    list_release(nullptr, rec_free);
    EXPECT_EQ(keys(list), (std::vector<int>{1}));

    // A node that claims a list whose head is already null.
    list_t empty;
    list_init(&empty);
    b->node.list = &empty;
    list_remove(&b->node);
    EXPECT_EQ(keys(empty), std::vector<int>{});
    rec_free(b);
}

TEST_F(ListTest, RangeToleratesFreeingTheCurrentRecord)
{
    for (int i = 0; i < 5; ++i)
        add(i);
    for (rec_t *r : korv::list_records<rec_t>(&list))
        if (r->key % 2 == 0)
            rec_free(r);
    EXPECT_EQ(keys(list), (std::vector<int>{1, 3}));
}

TEST_F(ListTest, AddUniqueTellsSameRecordFromEqualKey)
{
    auto same_key = [](rec_t *x, rec_t *y) { return x->key == y->key; };
    rec_t *a = rec_new(7), *twin = rec_new(7), *other = rec_new(8);
    EXPECT_EQ(korv::list_add_unique(&list, a, &a->node, same_key), 0);
    EXPECT_EQ(korv::list_add_unique(&list, a, &a->node, same_key), -1);
    EXPECT_EQ(korv::list_add_unique(&list, twin, &twin->node, same_key), -2);
    EXPECT_EQ(korv::list_add_unique(&list, other, &other->node, same_key), 0);
    EXPECT_EQ(keys(list), (std::vector<int>{7, 8}));
    rec_free(twin);
}

// Through list_owner: released when the fill fails, handed over in order to
// the tail when it succeeds.
TEST_F(ListTest, FillAndHandOverIsAllOrNothing)
{
    add(9);
    auto fill = [](int rc) {
        return [rc](list_t *got) {
            list_append(&rec_new(1)->node, got);
            list_append(&rec_new(2)->node, got);
            return rc;
        };
    };
    auto rec_free_list = [](list_t *l) { list_release(l, rec_free); };
    EXPECT_EQ(korv::fill_and_hand_over(&list, rec_free_list, fill(-9981)), -9981);
    EXPECT_EQ(keys(list), (std::vector<int>{9}));
    EXPECT_EQ(g_freed, 2);
    EXPECT_EQ(korv::fill_and_hand_over(&list, rec_free_list, fill(0)), 0);
    EXPECT_EQ(keys(list), (std::vector<int>{9, 1, 2}));
    EXPECT_EQ(g_freed, 2);
}

}  // namespace
