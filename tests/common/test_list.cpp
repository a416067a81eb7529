// SPDX-License-Identifier: Apache-2.0
// The intrusive list: linking, unlinking and releasing records.
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

std::vector<int> keys(const list_t &l)
{
    std::vector<int> out;
    for (rec_t *r : korv::list_records<rec_t>(&l))
        out.push_back(r->key);
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

TEST_F(ListTest, AppendAndRemoveKeepLinksAndCountRight)
{
    rec_t *r[4] = {add(0), add(1), add(2), add(3)};
    EXPECT_EQ(keys(list), (std::vector<int>{0, 1, 2, 3}));
    EXPECT_EQ(list.count, 4);
    EXPECT_EQ(r[1]->node.prev, &r[0]->node);
    EXPECT_EQ(r[1]->node.list, &list);
    EXPECT_EQ(list_next(&r[3]->node), nullptr);
    EXPECT_EQ(list_next(nullptr), nullptr);

    list_remove(&r[1]->node);  // middle
    EXPECT_EQ(r[2]->node.prev, &r[0]->node);
    list_remove(&r[0]->node);  // head
    list_remove(&r[3]->node);  // tail
    EXPECT_EQ(keys(list), (std::vector<int>{2}));
    EXPECT_EQ(list.head, list.tail);
    EXPECT_EQ(r[2]->node.prev, nullptr);
    EXPECT_EQ(r[2]->node.next, nullptr);

    // A removed node is clean and may be appended again.
    EXPECT_EQ(r[1]->node.list, nullptr);
    EXPECT_EQ(r[1]->node.next, nullptr);
    list_append(&r[1]->node, &list);
    EXPECT_EQ(keys(list), (std::vector<int>{2, 1}));

    // Removing the last nodes leaves null, null, 0.
    list_remove(&r[2]->node);
    list_remove(&r[1]->node);
    EXPECT_EQ(list.head, nullptr);
    EXPECT_EQ(list.tail, nullptr);
    EXPECT_EQ(list.count, 0);
    EXPECT_TRUE(list_is_empty(&list));
    for (rec_t *x : r)
        rec_free(x);
}

TEST_F(ListTest, RemovingUnlinkedNullOrFromEmptyListChangesNothing)
{
    rec_t *a = add(1), *b = rec_new(2);
    list_remove(&b->node);  // never linked
    list_remove(nullptr);
    EXPECT_EQ(list.count, 1);
    EXPECT_EQ(list.head, &a->node);

    // A node that claims a list whose head is already null.
    list_t empty;
    list_init(&empty);
    b->node.list = &empty;
    list_remove(&b->node);
    EXPECT_EQ(empty.count, 0);
    EXPECT_EQ(b->node.list, &empty);
    b->node.list = nullptr;
    rec_free(b);
}

TEST_F(ListTest, ReleaseFreesEveryRecordAndLeavesHeaderReusable)
{
    list_release(&list, rec_free);  // empty: nothing to do
    list_release(nullptr, rec_free);
    EXPECT_EQ(g_freed, 0);
    for (int i = 0; i < 3; ++i)
        add(i);
    list_release(&list, rec_free);
    EXPECT_EQ(g_freed, 3);
    EXPECT_TRUE(list_is_empty(&list));
    EXPECT_EQ(list.count, 0);
    EXPECT_EQ(list.tail, nullptr);
    add(9);
    EXPECT_EQ(keys(list), (std::vector<int>{9}));
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
    EXPECT_EQ(list.count, 1);
    EXPECT_EQ(korv::list_add_unique(&list, other, &other->node, same_key), 0);
    EXPECT_EQ(keys(list), (std::vector<int>{7, 8}));
    EXPECT_EQ(korv::list_find<rec_t>(&list, [](rec_t *r) { return r->key == 9; }), nullptr);
    rec_free(twin);
}

void rec_free_list(list_t *l)
{
    list_release(l, rec_free);
}

TEST_F(ListTest, OwnerReleasesWhatItStillHoldsAndHandsOverInOrder)
{
    {
        korv::list_owner owned(rec_free_list);
        for (int i = 0; i < 3; ++i)
            list_append(&rec_new(i)->node, owned.get());
    }
    EXPECT_EQ(g_freed, 3);

    add(9);
    korv::list_owner owned(rec_free_list);
    for (int i = 0; i < 3; ++i)
        list_append(&rec_new(i)->node, owned.get());
    owned.hand_over(&list);
    EXPECT_TRUE(list_is_empty(owned.get()));
    EXPECT_EQ(keys(list), (std::vector<int>{9, 0, 1, 2}));
    EXPECT_EQ(list.count, 4);
    EXPECT_EQ(list.tail->list, &list);
}

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
    EXPECT_EQ(korv::fill_and_hand_over(&list, rec_free_list, fill(-9981)), -9981);
    EXPECT_EQ(keys(list), (std::vector<int>{9}));
    EXPECT_EQ(g_freed, 2);
    EXPECT_EQ(korv::fill_and_hand_over(&list, rec_free_list, fill(0)), 0);
    EXPECT_EQ(keys(list), (std::vector<int>{9, 1, 2}));
}

}  // namespace
