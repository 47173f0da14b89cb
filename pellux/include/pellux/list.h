/* Ordered doubly-linked lists of caller data with a current-node cursor.
 *
 * The list holds void pointers it never dereferences; the caller owns the data unless it hands
 * a data-free function to a delete or free call. The cursor is either on a node or off the
 * list (null). Insertions leave the cursor where it is. Deleting the current node moves the
 * cursor to the node that followed it, so a loop that deletes must not also step forward.
 * Stepping forward from off the list lands on the head, backward on the tail; stepping past
 * either end leaves the cursor off the list. Sorting and reversing keep the cursor on the same
 * node. The nodes are public so that read-only loops may walk head -> next directly. */
#ifndef PELLUX_LIST_H
#define PELLUX_LIST_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Plx_ListNode {
    void *data;
    struct Plx_ListNode *prev, *next;
} Plx_ListNode;

typedef struct Plx_List {
    Plx_ListNode *head, *tail;
    Plx_ListNode *current;   /* the cursor; null when off the list */
    uint32_t size;
    uint32_t owned;          /* 1: the record came from the heap */
} Plx_List;

/* Releases one datum (free() fits). */
typedef void (*Plx_ListFreeFunc)(void *data);
/* Makes a copy of one datum; null reports failure. */
typedef void *(*Plx_ListCopyFunc)(const void *data);
/* Three-way comparison: negative, zero or positive as a sorts before, with or after b. */
typedef int (*Plx_ListCompareFunc)(const void *a, const void *b);

/* New empty list on the heap. */
PLX_API Plx_List *plx_list_new(void);
/* Empty list in caller storage (list null: on the heap, like plx_list_new). */
PLX_API Plx_List *plx_list_form(Plx_List *list);
/* Copy of a list in the same order with the cursor at the same position. copy null: on the
 * heap; otherwise copy is taken as unformed storage. copy_data null: the data pointers are
 * shared; otherwise each datum is copied, and when a copy fails the data copied so far are
 * released with free_data (when given) and the call fails. */
PLX_API Plx_List *plx_list_copy(const Plx_List *list, Plx_List *copy, Plx_ListCopyFunc copy_data,
                                Plx_ListFreeFunc free_data);
/* Deletes every node (each datum through free_data when given) and the record when owned;
 * a formed record is left empty and may be used again. */
PLX_API void plx_list_free(Plx_List *list, Plx_ListFreeFunc free_data);

PLX_API Plx_Bool plx_list_insert_first(Plx_List *list, void *data);
PLX_API Plx_Bool plx_list_insert_last(Plx_List *list, void *data);
/* Inserts after the current node; without one fails with code 31. */
PLX_API Plx_Bool plx_list_insert_after_current(Plx_List *list, void *data);

PLX_API void plx_list_goto_head(Plx_List *list);
PLX_API void plx_list_goto_tail(Plx_List *list);
/* Cursor onto node pos (0 = head); pos beyond the last node fails with code 32. */
PLX_API Plx_Bool plx_list_goto_pos(Plx_List *list, uint32_t pos);
/* Moves the cursor one node forward (from off the list: to the head) and returns the data of
 * the node it lands on, null when it leaves the list. */
PLX_API void *plx_list_get_next(Plx_List *list);
/* Moves the cursor one node backward (from off the list: to the tail); as get_next. */
PLX_API void *plx_list_get_prev(Plx_List *list);
/* Data of the current node; null when the cursor is off the list. */
PLX_API void *plx_list_get_current(const Plx_List *list);

/* Deletes the current node (its datum through free_data when given); the cursor moves to the
 * following node. Without a current node fails with code 31. */
PLX_API Plx_Bool plx_list_delete_current(Plx_List *list, Plx_ListFreeFunc free_data);
/* Deletes the tail; an empty list fails with code 23. A cursor on the tail goes off the list. */
PLX_API Plx_Bool plx_list_delete_last(Plx_List *list, Plx_ListFreeFunc free_data);
/* Deletes every node; the record stays formed and empty. */
PLX_API void plx_list_delete_all(Plx_List *list, Plx_ListFreeFunc free_data);

PLX_API uint32_t plx_list_get_size(const Plx_List *list);
/* Stable ascending sort (equal data keep their order). */
PLX_API Plx_Bool plx_list_sort_ascending(Plx_List *list, Plx_ListCompareFunc compare);
PLX_API void plx_list_reverse(Plx_List *list);

#ifdef __cplusplus
}
#endif

#endif
