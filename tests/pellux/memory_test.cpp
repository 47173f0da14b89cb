// Memory stack: alignment, disjoint pieces, growth by blocks, limits, marks.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "pellux/pellux.h"

namespace {

int32_t origin_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : 0;
}

bool aligned(const void *p) { return reinterpret_cast<uintptr_t>(p) % alignof(std::max_align_t) == 0; }

}  // namespace

TEST(MemoryStack, PiecesAreAlignedDisjointAndSpreadOverBlocks)
{
    Plx_MemoryStack *ms = plx_memory_stack_form(nullptr, 0, 100);
    ASSERT_NE(ms, nullptr);
    EXPECT_EQ(ms->owned, 1u);
    EXPECT_EQ(ms->block_count, 0u);  // nothing allocated until asked

    // Odd sizes, one oversize request among them; every piece is filled with its own byte
    // and checked after all allocations, so an overlap shows up.
    std::vector<size_t> sizes{1, 7, 13, 64, 3, 500, 9, 100, 2, 33, 8, 8, 8};
    std::vector<unsigned char *> pieces;
    for (size_t i = 0; i < sizes.size(); ++i) {
        auto *p = static_cast<unsigned char *>(plx_memory_stack_alloc(ms, sizes[i]));
        ASSERT_NE(p, nullptr);
        EXPECT_TRUE(aligned(p)) << i;
        std::memset(p, static_cast<int>(i + 1), sizes[i]);
        pieces.push_back(p);
    }
    for (size_t i = 0; i < sizes.size(); ++i)
        for (size_t b = 0; b < sizes[i]; ++b) ASSERT_EQ(pieces[i][b], i + 1) << i;
    EXPECT_GE(ms->block_count, 5u);

    double *d = static_cast<double *>(plx_memory_stack_alloc(ms, 3 * sizeof(double)));
    ASSERT_NE(d, nullptr);
    d[0] = 1.5;
    d[2] = -2.0;
    EXPECT_EQ(d[0] + d[2], -0.5);
    plx_memory_stack_free(ms);
}

TEST(MemoryStack, RewindReusesBlocksAndLimitsHold)
{
    Plx_MemoryStack ms;
    ASSERT_EQ(plx_memory_stack_form(&ms, 3, 256), &ms);
    Plx_MemoryStackMark start = plx_memory_stack_mark(&ms);
    void *a = plx_memory_stack_alloc(&ms, 200);
    ASSERT_NE(a, nullptr);
    Plx_MemoryStackMark after_a = plx_memory_stack_mark(&ms);
    void *b = plx_memory_stack_alloc(&ms, 200);  // second block
    void *c = plx_memory_stack_alloc(&ms, 200);  // third block
    ASSERT_NE(b, nullptr);
    ASSERT_NE(c, nullptr);
    EXPECT_EQ(ms.block_count, 3u);
    EXPECT_EQ(plx_memory_stack_alloc(&ms, 200), nullptr);  // limit of three blocks
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);

    // Back to after a: the same pattern of requests gets the same pieces, no new block.
    ASSERT_TRUE(plx_memory_stack_rewind(&ms, after_a));
    EXPECT_EQ(plx_memory_stack_alloc(&ms, 200), b);
    EXPECT_EQ(plx_memory_stack_alloc(&ms, 200), c);
    EXPECT_EQ(ms.block_count, 3u);

    ASSERT_TRUE(plx_memory_stack_rewind(&ms, start));
    EXPECT_EQ(plx_memory_stack_alloc(&ms, 16), a);
    EXPECT_EQ(plx_memory_stack_alloc(&ms, 16), static_cast<unsigned char *>(a) + 16);

    Plx_MemoryStackMark foreign{reinterpret_cast<Plx_MemoryBlock *>(&ms), 0};
    EXPECT_FALSE(plx_memory_stack_rewind(&ms, foreign));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    plx_memory_stack_free(&ms);
    EXPECT_EQ(ms.first, nullptr);

    EXPECT_EQ(plx_memory_stack_form(&ms, 1, 0), nullptr);
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(plx_memory_stack_alloc(nullptr, 8), nullptr);
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
}

TEST(MemoryStack, FreeVaReleasesEveryBlockIncludingAfterNulls)
{
    // LeakSanitizer reports any of the three that is not released.
    void *p = std::malloc(10), *q = std::malloc(20), *r = std::malloc(30);
    plx_free_va(5, p, static_cast<void *>(nullptr), q, static_cast<void *>(nullptr), r);
    plx_free_va(0);
}
