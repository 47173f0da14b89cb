// The memory stack and the multi-block free.
#include "pellux/memory.h"

#include <cstdarg>
#include <cstddef>
#include <cstdlib>
#include <limits>

#include "pellux/detail/util.hpp"
#include "pellux/error.h"

// A block header followed by its bytes; the header size is a multiple of the alignment so the
// first piece of every block is aligned as malloc's result is.
struct Plx_MemoryBlock {
    Plx_MemoryBlock *next;
    size_t size;
    size_t used;
};

namespace {

constexpr size_t kAlign = alignof(std::max_align_t);
constexpr size_t kHeader = (sizeof(Plx_MemoryBlock) + kAlign - 1) / kAlign * kAlign;

unsigned char *block_bytes(Plx_MemoryBlock *block)
{
    return reinterpret_cast<unsigned char *>(block) + kHeader;
}

size_t round_up(size_t size) { return (size + kAlign - 1) / kAlign * kAlign; }

}  // namespace

extern "C" {

PLX_API Plx_MemoryStack *plx_memory_stack_form(Plx_MemoryStack *stack, uint32_t max_blocks,
                                               size_t block_size)
{
    if (block_size == 0 || block_size > std::numeric_limits<size_t>::max() / 2) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "block size out of range", static_cast<int64_t>(block_size));
        return nullptr;
    }
    bool owned = stack == nullptr;
    if (owned) {
        stack = PLX_ALLOC(Plx_MemoryStack, 1);
        if (stack == nullptr) return nullptr;
    }
    stack->block_size = round_up(block_size);
    stack->max_blocks = max_blocks;
    stack->block_count = 0;
    stack->first = nullptr;
    stack->current = nullptr;
    stack->owned = owned ? 1u : 0u;
    return stack;
}

PLX_API void *plx_memory_stack_alloc(Plx_MemoryStack *stack, size_t size)
{
    if (stack == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null stack", 0);
        return nullptr;
    }
    if (size > std::numeric_limits<size_t>::max() / 2) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "size out of range", -1);
        return nullptr;
    }
    size_t need = round_up(size);
    Plx_MemoryBlock *block = stack->current;
    if (block != nullptr && block->size - block->used >= need) {
        void *piece = block_bytes(block) + block->used;
        block->used += need;
        return piece;
    }
    // The next block of the chain is reused when it is large enough (after a rewind);
    // otherwise a fresh block goes in right after the current one.
    Plx_MemoryBlock *next = block != nullptr ? block->next : stack->first;
    if (next != nullptr && next->size >= need) {
        next->used = need;
        stack->current = next;
        return block_bytes(next);
    }
    if (stack->max_blocks != 0 && stack->block_count >= stack->max_blocks) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "memory stack has no block left", stack->block_count);
        return nullptr;
    }
    size_t bytes = need > stack->block_size ? need : stack->block_size;
    Plx_MemoryBlock *fresh =
        reinterpret_cast<Plx_MemoryBlock *>(PLX_ALLOC(unsigned char, kHeader + bytes));
    if (fresh == nullptr) return nullptr;
    fresh->size = bytes;
    fresh->used = need;
    fresh->next = next;
    if (block != nullptr) block->next = fresh;
    else stack->first = fresh;
    stack->current = fresh;
    ++stack->block_count;
    return block_bytes(fresh);
}

PLX_API Plx_MemoryStackMark plx_memory_stack_mark(const Plx_MemoryStack *stack)
{
    Plx_MemoryStackMark mark{nullptr, 0};
    if (stack != nullptr && stack->current != nullptr) {
        mark.block = stack->current;
        mark.used = stack->current->used;
    }
    return mark;
}

PLX_API Plx_Bool plx_memory_stack_rewind(Plx_MemoryStack *stack, Plx_MemoryStackMark mark)
{
    if (stack == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null stack", 0);
        return PLX_FALSE;
    }
    if (mark.block == nullptr) {  // taken before the first allocation
        if (mark.used != 0) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "mark does not belong to this stack", 0);
            return PLX_FALSE;
        }
        stack->current = nullptr;
        return PLX_TRUE;
    }
    Plx_MemoryBlock *block = stack->first;
    while (block != nullptr && block != mark.block) block = block->next;
    if (block == nullptr || mark.used > block->size) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "mark does not belong to this stack", 0);
        return PLX_FALSE;
    }
    block->used = mark.used;
    stack->current = block;
    return PLX_TRUE;
}

PLX_API void plx_memory_stack_free(Plx_MemoryStack *stack)
{
    if (stack == nullptr) return;
    Plx_MemoryBlock *block = stack->first;
    while (block != nullptr) {
        Plx_MemoryBlock *next = block->next;
        std::free(block);
        block = next;
    }
    stack->first = stack->current = nullptr;
    stack->block_count = 0;
    if (stack->owned) std::free(stack);
}

PLX_API void plx_free_va(uint32_t count, ...)
{
    va_list args;
    va_start(args, count);
    for (uint32_t i = 0; i < count; ++i) std::free(va_arg(args, void *));
    va_end(args);
}

}  // extern "C"
