// Lists: cursor movement, insertion and deletion around the cursor, stable sorting, copies.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <random>
#include <vector>

#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

// The data of a list walked through the public links, checking that prev mirrors next.
template <class T = int>
std::vector<T *> contents(const Plx_List *list)
{
    std::vector<T *> out;
    const Plx_ListNode *prev = nullptr;
    for (const Plx_ListNode *n = list->head; n != nullptr; n = n->next) {
        EXPECT_EQ(n->prev, prev);
        out.push_back(static_cast<T *>(n->data));
        prev = n;
    }
    EXPECT_EQ(list->tail, prev);
    EXPECT_EQ(list->size, out.size());
    return out;
}

int frees = 0;
void count_free(void *) { ++frees; }

struct Keyed {
    int key;
    int seq;
};
int by_key(const void *a, const void *b)
{
    int ka = static_cast<const Keyed *>(a)->key, kb = static_cast<const Keyed *>(b)->key;
    return (ka > kb) - (ka < kb);
}

}  // namespace

TEST(List, CursorWalksBothWaysAndFallsOffTheEnds)
{
    int v[4] = {0, 1, 2, 3};
    Plx_List list;
    ASSERT_EQ(plx_list_form(&list), &list);
    EXPECT_EQ(plx_list_get_next(&list), nullptr);  // empty: stays off
    ASSERT_TRUE(plx_list_insert_last(&list, &v[1]));
    ASSERT_TRUE(plx_list_insert_last(&list, &v[2]));
    ASSERT_TRUE(plx_list_insert_first(&list, &v[0]));
    EXPECT_EQ(plx_list_get_current(&list), nullptr);  // insertions leave the cursor off
    EXPECT_EQ(contents(&list), (std::vector<int *>{&v[0], &v[1], &v[2]}));

    EXPECT_EQ(plx_list_get_next(&list), &v[0]);  // from off the list onto the head
    EXPECT_EQ(plx_list_get_next(&list), &v[1]);
    EXPECT_EQ(plx_list_get_next(&list), &v[2]);
    EXPECT_EQ(plx_list_get_next(&list), nullptr);
    EXPECT_EQ(plx_list_get_current(&list), nullptr);
    EXPECT_EQ(plx_list_get_prev(&list), &v[2]);  // from off the list onto the tail
    EXPECT_EQ(plx_list_get_prev(&list), &v[1]);

    ASSERT_TRUE(plx_list_goto_pos(&list, 2));
    EXPECT_EQ(plx_list_get_current(&list), &v[2]);
    ASSERT_TRUE(plx_list_goto_pos(&list, 0));
    EXPECT_TRUE(fails_with(plx_list_goto_pos(&list, 3), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_EQ(plx_list_get_current(&list), &v[0]);  // a failed move leaves the cursor alone

    ASSERT_TRUE(plx_list_insert_after_current(&list, &v[3]));
    EXPECT_EQ(plx_list_get_current(&list), &v[0]);
    EXPECT_EQ(contents(&list), (std::vector<int *>{&v[0], &v[3], &v[1], &v[2]}));
    plx_list_goto_tail(&list);
    ASSERT_TRUE(plx_list_insert_after_current(&list, &v[3]));  // after the tail: new tail
    EXPECT_EQ(list.tail->data, &v[3]);
    plx_list_goto_head(&list);
    EXPECT_EQ(plx_list_get_current(&list), &v[0]);
    plx_list_free(&list, nullptr);
    EXPECT_EQ(list.size, 0u);
    EXPECT_EQ(list.head, nullptr);

    Plx_List *heap = plx_list_new();
    ASSERT_NE(heap, nullptr);
    EXPECT_TRUE(fails_with(plx_list_insert_after_current(heap, &v[0]), PLX_ERROR_NOT_INITIALISED));
    EXPECT_EQ(plx_list_get_size(heap), 0u);
    plx_list_free(heap, nullptr);
}

TEST(List, DeletionsMoveTheCursorAndReleaseData)
{
    Plx_List *list = plx_list_new();
    ASSERT_NE(list, nullptr);
    EXPECT_TRUE(fails_with(plx_list_delete_last(list, nullptr), PLX_ERROR_NO_DATA));
    EXPECT_TRUE(fails_with(plx_list_delete_current(list, nullptr), PLX_ERROR_NOT_INITIALISED));

    std::vector<int> v{10, 11, 12, 13, 14};
    for (int &x : v) ASSERT_TRUE(plx_list_insert_last(list, &x));
    frees = 0;

    // Removing every odd value while walking: delete moves onto the following node.
    plx_list_goto_head(list);
    while (plx_list_get_current(list) != nullptr) {
        if (*static_cast<int *>(plx_list_get_current(list)) % 2 != 0) {
            ASSERT_TRUE(plx_list_delete_current(list, count_free));
        } else {
            plx_list_get_next(list);
        }
    }
    EXPECT_EQ(frees, 2);
    EXPECT_EQ(contents(list), (std::vector<int *>{&v[0], &v[2], &v[4]}));

    plx_list_goto_tail(list);
    ASSERT_TRUE(plx_list_delete_current(list, nullptr));  // deleting the tail leaves the list
    EXPECT_EQ(plx_list_get_current(list), nullptr);
    EXPECT_EQ(list->tail->data, &v[2]);

    plx_list_goto_tail(list);
    ASSERT_TRUE(plx_list_delete_last(list, count_free));
    EXPECT_EQ(plx_list_get_current(list), nullptr);
    EXPECT_EQ(frees, 3);
    EXPECT_EQ(contents(list), (std::vector<int *>{&v[0]}));
    ASSERT_TRUE(plx_list_delete_last(list, nullptr));
    EXPECT_EQ(list->head, nullptr);
    EXPECT_EQ(list->tail, nullptr);

    for (int &x : v) ASSERT_TRUE(plx_list_insert_first(list, &x));
    plx_list_delete_all(list, count_free);
    EXPECT_EQ(frees, 8);
    EXPECT_EQ(plx_list_get_size(list), 0u);
    ASSERT_TRUE(plx_list_insert_first(list, &v[0]));  // still usable
    plx_list_free(list, count_free);
    EXPECT_EQ(frees, 9);
}

TEST(List, SortIsStableAndReverseKeepsTheCursorNode)
{
    std::mt19937 rng(7);
    for (int n : {0, 1, 2, 3, 5, 8, 17, 64, 129}) {
        std::vector<Keyed> items(n);
        for (int i = 0; i < n; ++i) items[i] = {static_cast<int>(rng() % 5), i};
        Plx_List list;
        plx_list_form(&list);
        for (Keyed &k : items) ASSERT_TRUE(plx_list_insert_last(&list, &k));
        if (n > 0) {
            ASSERT_TRUE(plx_list_goto_pos(&list, static_cast<uint32_t>(n / 2)));
        }
        void *cursor = plx_list_get_current(&list);

        ASSERT_TRUE(plx_list_sort_ascending(&list, by_key));
        std::vector<Keyed *> expected;
        for (Keyed &k : items) expected.push_back(&k);
        std::stable_sort(expected.begin(), expected.end(), [](const Keyed *a, const Keyed *b) { return a->key < b->key; });
        EXPECT_EQ(contents<Keyed>(&list), expected) << n;
        EXPECT_EQ(plx_list_get_current(&list), cursor);

        plx_list_reverse(&list);
        EXPECT_EQ(contents<Keyed>(&list), std::vector<Keyed *>(expected.rbegin(), expected.rend()));
        EXPECT_EQ(plx_list_get_current(&list), cursor);
        plx_list_free(&list, nullptr);
    }
    EXPECT_TRUE(fails_with(plx_list_sort_ascending(nullptr, by_key), PLX_ERROR_ILLEGAL_ARGUMENT));
}

namespace {
int copies_left = 0;  // copies allowed before the copy function reports failure
void *copy_int(const void *p)
{
    if (copies_left-- <= 0) return nullptr;
    int *q = static_cast<int *>(std::malloc(sizeof(int)));
    if (q != nullptr) *q = *static_cast<const int *>(p);
    return q;
}
}  // namespace

TEST(List, CopiesShareOrDuplicateDataAndFailCleanly)
{
    int v[3] = {1, 2, 3};
    Plx_List list;
    plx_list_form(&list);
    for (int &x : v) plx_list_insert_last(&list, &x);
    plx_list_goto_pos(&list, 1);

    Plx_List *shared = plx_list_copy(&list, nullptr, nullptr, nullptr);
    ASSERT_NE(shared, nullptr);
    EXPECT_EQ(contents(shared), contents(&list));
    EXPECT_EQ(plx_list_get_current(shared), &v[1]);  // cursor at the same position
    plx_list_free(shared, nullptr);

    copies_left = 3;
    Plx_List deep;
    ASSERT_EQ(plx_list_copy(&list, &deep, copy_int, std::free), &deep);
    std::vector<int *> d = contents(&deep);
    ASSERT_EQ(d.size(), 3u);
    for (int i = 0; i < 3; ++i) {
        EXPECT_NE(d[i], &v[i]);
        EXPECT_EQ(*d[i], v[i]);
    }
    EXPECT_EQ(*static_cast<int *>(plx_list_get_current(&deep)), 2);
    plx_list_free(&deep, std::free);

    // The third copy fails: the two made are released (LeakSanitizer checks) and the
    // destination keeps what it held.
    copies_left = 2;
    Plx_List untouched;
    plx_list_form(&untouched);
    plx_list_insert_first(&untouched, &v[0]);
    Plx_List before = untouched;
    EXPECT_TRUE(fails_with(plx_list_copy(&list, &untouched, copy_int, std::free), PLX_ERROR_CALLEE));
    EXPECT_EQ(untouched.head, before.head);
    EXPECT_EQ(untouched.size, 1u);
    plx_list_free(&untouched, nullptr);
    plx_list_free(&list, nullptr);
}
