/* A stack allocator for many small records that die together, and a multi-block free.
 *
 * A Plx_MemoryStack hands out pieces of large blocks, each piece aligned for any scalar type
 * (doubles included). Blocks are allocated only when needed, chained one after another, and
 * kept for reuse after a rewind; a request larger than the block size gets a block of its own.
 * Pieces are never freed one by one: rewind to a mark taken earlier (everything allocated
 * after the mark is released at once, the blocks are kept) or free the whole stack. */
#ifndef PELLUX_MEMORY_H
#define PELLUX_MEMORY_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Plx_MemoryBlock Plx_MemoryBlock;

typedef struct Plx_MemoryStack {
    size_t block_size;         /* usable bytes of an ordinary block */
    uint32_t max_blocks;       /* most blocks ever allocated at once (0: no limit) */
    uint32_t block_count;      /* blocks allocated so far */
    Plx_MemoryBlock *first;    /* the chain, in allocation order of the stack */
    Plx_MemoryBlock *current;  /* the block pieces are taken from; null before the first */
    uint32_t owned;            /* 1: the record came from the heap */
} Plx_MemoryStack;

/* A position in a stack, for plx_memory_stack_rewind. */
typedef struct Plx_MemoryStackMark {
    Plx_MemoryBlock *block;
    size_t used;
} Plx_MemoryStackMark;

/* Forms a stack of at most max_blocks blocks (0: no limit) of block_size bytes each; no block
 * is allocated yet. stack null: on the heap. A zero block size fails with code 32. */
PLX_API Plx_MemoryStack *plx_memory_stack_form(Plx_MemoryStack *stack, uint32_t max_blocks,
                                               size_t block_size);
/* A piece of size bytes aligned for any scalar type. Fails with code 7 when a new block is
 * needed and max_blocks are in use, code 5 when the block cannot be allocated. */
PLX_API void *plx_memory_stack_alloc(Plx_MemoryStack *stack, size_t size);
/* The current position. */
PLX_API Plx_MemoryStackMark plx_memory_stack_mark(const Plx_MemoryStack *stack);
/* Releases every piece allocated after the mark (the blocks stay for reuse); a mark that does
 * not belong to the stack fails with code 32. */
PLX_API Plx_Bool plx_memory_stack_rewind(Plx_MemoryStack *stack, Plx_MemoryStackMark mark);
/* Releases every block, and the record when owned; a formed record must be formed again. */
PLX_API void plx_memory_stack_free(Plx_MemoryStack *stack);

/* free() of count heap blocks given as the following arguments (void pointers, any of them
 * null); count rather than a null terminator, so that a block never allocated cannot cut the
 * list short. */
PLX_API void plx_free_va(uint32_t count, ...);

#ifdef __cplusplus
}
#endif

#endif
