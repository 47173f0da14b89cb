// Doubly-linked lists with a cursor.
#include "pellux/list.h"

#include <cstdlib>

#include "pellux/detail/util.hpp"
#include "pellux/error.h"

namespace {

void release_nodes(Plx_List *list, Plx_ListFreeFunc free_data)
{
    Plx_ListNode *node = list->head;
    while (node != nullptr) {
        Plx_ListNode *next = node->next;
        if (free_data != nullptr) free_data(node->data);
        std::free(node);
        node = next;
    }
    list->head = list->tail = list->current = nullptr;
    list->size = 0;
}

void unlink(Plx_List *list, Plx_ListNode *node)
{
    if (node->prev != nullptr) node->prev->next = node->next;
    else list->head = node->next;
    if (node->next != nullptr) node->next->prev = node->prev;
    else list->tail = node->prev;
    --list->size;
}

// Links node between prev and next (either may be null at the ends).
void link_between(Plx_List *list, Plx_ListNode *node, Plx_ListNode *prev, Plx_ListNode *next)
{
    node->prev = prev;
    node->next = next;
    if (prev != nullptr) prev->next = node;
    else list->head = node;
    if (next != nullptr) next->prev = node;
    else list->tail = node;
    ++list->size;
}

// Merges two sorted singly-linked runs; on ties the left run goes first, which is what keeps
// the sort stable.
Plx_ListNode *merge(Plx_ListNode *a, Plx_ListNode *b, Plx_ListCompareFunc compare)
{
    Plx_ListNode head{nullptr, nullptr, nullptr};
    Plx_ListNode *tail = &head;
    while (a != nullptr && b != nullptr) {
        if (compare(b->data, a->data) < 0) {
            tail->next = b;
            b = b->next;
        } else {
            tail->next = a;
            a = a->next;
        }
        tail = tail->next;
    }
    tail->next = a != nullptr ? a : b;
    return head.next;
}

}  // namespace

extern "C" {

PLX_API Plx_List *plx_list_form(Plx_List *list)
{
    bool owned = list == nullptr;
    if (owned) {
        list = PLX_ALLOC(Plx_List, 1);
        if (list == nullptr) return nullptr;
    }
    list->head = list->tail = list->current = nullptr;
    list->size = 0;
    list->owned = owned ? 1u : 0u;
    return list;
}

PLX_API Plx_List *plx_list_new(void)
{
    Plx_List *list = plx_list_form(nullptr);
    if (list == nullptr) PLX_ERR_PASS();
    return list;
}

PLX_API Plx_List *plx_list_copy(const Plx_List *list, Plx_List *copy, Plx_ListCopyFunc copy_data,
                                Plx_ListFreeFunc free_data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return nullptr;
    }
    // Built aside so that a failure leaves the caller's storage untouched.
    Plx_List built;
    plx_list_form(&built);
    for (const Plx_ListNode *node = list->head; node != nullptr; node = node->next) {
        void *data = node->data;
        if (copy_data != nullptr && data != nullptr) {
            data = copy_data(data);
            if (data == nullptr) {
                int64_t position = built.size;
                release_nodes(&built, free_data);
                PLX_ERR_START(PLX_ERROR_CALLEE, "datum copy failed", position);
                return nullptr;
            }
        }
        Plx_ListNode *fresh = PLX_ALLOC(Plx_ListNode, 1);
        if (fresh == nullptr) {  // code 5 registered by the allocation
            if (copy_data != nullptr && free_data != nullptr) free_data(data);
            release_nodes(&built, copy_data != nullptr ? free_data : nullptr);
            return nullptr;
        }
        fresh->data = data;
        link_between(&built, fresh, built.tail, nullptr);
        if (node == list->current) built.current = fresh;
    }
    if (copy == nullptr) {
        copy = PLX_ALLOC(Plx_List, 1);
        if (copy == nullptr) {
            release_nodes(&built, copy_data != nullptr ? free_data : nullptr);
            return nullptr;
        }
        built.owned = 1;
    }
    *copy = built;
    return copy;
}

PLX_API void plx_list_free(Plx_List *list, Plx_ListFreeFunc free_data)
{
    if (list == nullptr) return;
    release_nodes(list, free_data);
    if (list->owned) std::free(list);
}

PLX_API Plx_Bool plx_list_insert_first(Plx_List *list, void *data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    Plx_ListNode *node = PLX_ALLOC(Plx_ListNode, 1);
    if (node == nullptr) return PLX_FALSE;
    node->data = data;
    link_between(list, node, nullptr, list->head);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_list_insert_last(Plx_List *list, void *data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    Plx_ListNode *node = PLX_ALLOC(Plx_ListNode, 1);
    if (node == nullptr) return PLX_FALSE;
    node->data = data;
    link_between(list, node, list->tail, nullptr);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_list_insert_after_current(Plx_List *list, void *data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    if (list->current == nullptr) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "no current node", 0);
        return PLX_FALSE;
    }
    Plx_ListNode *node = PLX_ALLOC(Plx_ListNode, 1);
    if (node == nullptr) return PLX_FALSE;
    node->data = data;
    link_between(list, node, list->current, list->current->next);
    return PLX_TRUE;
}

PLX_API void plx_list_goto_head(Plx_List *list)
{
    if (list != nullptr) list->current = list->head;
}

PLX_API void plx_list_goto_tail(Plx_List *list)
{
    if (list != nullptr) list->current = list->tail;
}

PLX_API Plx_Bool plx_list_goto_pos(Plx_List *list, uint32_t pos)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    if (pos >= list->size) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "position beyond the list", pos);
        return PLX_FALSE;
    }
    // Walk from the nearer end.
    Plx_ListNode *node;
    if (pos <= list->size / 2) {
        node = list->head;
        for (uint32_t i = 0; i < pos; ++i) node = node->next;
    } else {
        node = list->tail;
        for (uint32_t i = list->size - 1; i > pos; --i) node = node->prev;
    }
    list->current = node;
    return PLX_TRUE;
}

PLX_API void *plx_list_get_next(Plx_List *list)
{
    if (list == nullptr) return nullptr;
    list->current = list->current == nullptr ? list->head : list->current->next;
    return list->current != nullptr ? list->current->data : nullptr;
}

PLX_API void *plx_list_get_prev(Plx_List *list)
{
    if (list == nullptr) return nullptr;
    list->current = list->current == nullptr ? list->tail : list->current->prev;
    return list->current != nullptr ? list->current->data : nullptr;
}

PLX_API void *plx_list_get_current(const Plx_List *list)
{
    if (list == nullptr || list->current == nullptr) return nullptr;
    return list->current->data;
}

PLX_API Plx_Bool plx_list_delete_current(Plx_List *list, Plx_ListFreeFunc free_data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    Plx_ListNode *node = list->current;
    if (node == nullptr) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "no current node", 0);
        return PLX_FALSE;
    }
    list->current = node->next;
    unlink(list, node);
    if (free_data != nullptr) free_data(node->data);
    std::free(node);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_list_delete_last(Plx_List *list, Plx_ListFreeFunc free_data)
{
    if (list == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null list", 0);
        return PLX_FALSE;
    }
    Plx_ListNode *node = list->tail;
    if (node == nullptr) {
        PLX_ERR_START(PLX_ERROR_NO_DATA, "empty list", 0);
        return PLX_FALSE;
    }
    if (list->current == node) list->current = nullptr;
    unlink(list, node);
    if (free_data != nullptr) free_data(node->data);
    std::free(node);
    return PLX_TRUE;
}

PLX_API void plx_list_delete_all(Plx_List *list, Plx_ListFreeFunc free_data)
{
    if (list != nullptr) release_nodes(list, free_data);
}

PLX_API uint32_t plx_list_get_size(const Plx_List *list) { return list != nullptr ? list->size : 0; }

PLX_API Plx_Bool plx_list_sort_ascending(Plx_List *list, Plx_ListCompareFunc compare)
{
    if (list == nullptr || compare == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, list == nullptr ? "null list" : "null comparison", 0);
        return PLX_FALSE;
    }
    if (list->size < 2) return PLX_TRUE;
    // Bottom-up merge sort over the next links: O(n log n) with no extra memory, so it
    // cannot fail half-way. The prev links are rebuilt at the end.
    Plx_ListNode *first = list->head;
    list->tail->next = nullptr;
    for (uint32_t width = 1; width < list->size; width *= 2) {
        Plx_ListNode *rest = first;
        Plx_ListNode *merged_head = nullptr;
        Plx_ListNode *merged_tail = nullptr;
        while (rest != nullptr) {
            Plx_ListNode *a = rest;
            Plx_ListNode *cut = a;
            for (uint32_t i = 1; i < width && cut->next != nullptr; ++i) cut = cut->next;
            Plx_ListNode *b = cut->next;
            cut->next = nullptr;
            Plx_ListNode *bend = b;
            for (uint32_t i = 1; i < width && bend != nullptr && bend->next != nullptr; ++i) bend = bend->next;
            if (bend != nullptr) {
                rest = bend->next;
                bend->next = nullptr;
            } else {
                rest = nullptr;
            }
            Plx_ListNode *run = merge(a, b, compare);
            if (merged_tail == nullptr) merged_head = run;
            else merged_tail->next = run;
            merged_tail = run;
            while (merged_tail->next != nullptr) merged_tail = merged_tail->next;
        }
        first = merged_head;
    }
    Plx_ListNode *prev = nullptr;
    for (Plx_ListNode *node = first; node != nullptr; node = node->next) {
        node->prev = prev;
        prev = node;
    }
    list->head = first;
    list->tail = prev;
    return PLX_TRUE;
}

PLX_API void plx_list_reverse(Plx_List *list)
{
    if (list == nullptr) return;
    Plx_ListNode *node = list->head;
    while (node != nullptr) {
        Plx_ListNode *next = node->next;
        node->next = node->prev;
        node->prev = next;
        node = next;
    }
    Plx_ListNode *old_head = list->head;
    list->head = list->tail;
    list->tail = old_head;
}

}  // extern "C"
