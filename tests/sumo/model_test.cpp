// The optimiser's model: numbering, lists, blocks, copies and the failures a caller can cause.
#include "sumo_test_util.hpp"

using namespace sumo_test;

namespace {

struct Model {
    SumoPtr sumo{pSumoForm(nullptr, nullptr)};
    WorkspacePtr ws{pSumoWorkspaceForm(nullptr)};

    SumoStateVector *state(SumoBranch *b, uint32_t n, bool init = true)
    {
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), b, n, nullptr, nullptr);
        EXPECT_NE(s, nullptr);
        if (init) {
            EXPECT_TRUE(bSumoStateVectorInit(sumo.get(), s, nullptr));
        }
        return s;
    }
    SumoObs *link(SumoStateVector *a, SumoStateVector *b)
    {
        Vec z{0.0, 0.0};
        Squ N(2, 1.0);
        SumoStateVector *st[2] = {a, b};
        return pSumoObsH(sumo.get(), &z.v, &N.m, h_difference, nullptr, st, 2);
    }
};

TEST(SumoModel, NumberingFollowsEliminationOrder)
{
    Model m;
    SumoBranch *root = m.sumo->root;
    SumoStateVector *r0 = m.state(root, 2);
    SumoStateVector *r1 = m.state(root, 2);
    SumoStateVector *u = m.state(root, 2, false);
    SumoStateVector *r2 = m.state(root, 2);
    SumoBranch *hang = pSumoBranchNewFromState(m.sumo.get(), r1);
    SumoStateVector *h0 = m.state(hang, 2);
    SumoStateVector *h1 = m.state(hang, 2);
    SumoBranch *sb = pSumoBranchNewFromBranch(m.sumo.get(), root);
    SumoStateVector *s0 = m.state(sb, 2);
    // A branch made from root now sits between root and sb: sb is numbered first.
    SumoBranch *tb = pSumoBranchNewFromBranch(m.sumo.get(), root);
    ASSERT_EQ(root->sub, tb);
    ASSERT_EQ(tb->sub, sb);
    ASSERT_EQ(sb->parent, tb);
    SumoStateVector *t0 = m.state(tb, 2);
    ASSERT_TRUE(bSumoSetStateIndices(m.sumo.get()));
    EXPECT_EQ(s0->index, 0u);
    EXPECT_EQ(t0->index, 1u);
    EXPECT_EQ(r0->index, 2u);
    EXPECT_EQ(h0->index, 3u);
    EXPECT_EQ(h1->index, 4u);
    EXPECT_EQ(r1->index, 5u);
    EXPECT_EQ(r2->index, 6u);
    EXPECT_EQ(u->index, 0u);  // its own sequence
    EXPECT_EQ(root->first_index, 2u);
    EXPECT_EQ(root->last_index, 6u);
    EXPECT_EQ(hang->last_index, 4u);

    uint32_t f, l;
    ASSERT_TRUE(bSumoGetIndexLimitsBranch(root, &f, &l));
    EXPECT_EQ(f, 0u);
    EXPECT_EQ(l, 6u);
    ASSERT_TRUE(bSumoGetIndexLimitsState(r1, &f, &l));
    EXPECT_EQ(f, 3u);
    EXPECT_EQ(l, 5u);
    ASSERT_TRUE(bSumoGetIndexLimitsState(u, &f, &l));
    EXPECT_EQ(f, 0xFFFFFFFFu);
    ASSERT_TRUE(bSumoGetIndexLimitsStateRange(r1, r2, &f, &l));
    EXPECT_EQ(f, 3u);
    EXPECT_EQ(l, 6u);
    EXPECT_TRUE(fails_with(bSumoGetIndexLimitsStateRange(r2, r0, &f, &l), PLX_ERROR_INCOMPATIBLE));
    uint32_t ef, el;
    ASSERT_TRUE(bSumoGetIndexLimitsBranch(hang, &ef, &el));
    EXPECT_EQ(ef, 3u);
    EXPECT_EQ(el, 4u);

    // Inserting before and after keeps the list order.
    SumoStateVector *b0 = pSumoStateVectorNewBefore(m.sumo.get(), root, 1, nullptr, r0, nullptr);
    SumoStateVector *a2 = pSumoStateVectorNewAfter(m.sumo.get(), root, 1, nullptr, r2, nullptr);
    ASSERT_TRUE(b0 && a2);
    EXPECT_EQ(root->first, b0);
    EXPECT_EQ(root->last, a2);
    EXPECT_EQ(pSumoStateVectorNewBefore(m.sumo.get(), root, 1, nullptr, h0, nullptr), nullptr);
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
}

TEST(SumoModel, ObservationListsAndStateChecks)
{
    Model m;
    SumoBranch *root = m.sumo->root;
    SumoStateVector *a = m.state(root, 2), *b = m.state(root, 2), *c = m.state(root, 2);
    SumoObs *ab = m.link(a, b);
    SumoObs *bc = m.link(b, c);
    ASSERT_TRUE(ab && bc);
    // Newest first, in the model and in each state's list.
    EXPECT_EQ(m.sumo->obs_active, bc);
    EXPECT_EQ(bc->next, ab);
    EXPECT_EQ(b->obs_active, bc);
    EXPECT_EQ(pSumoObsGetNext(bc, b), ab);
    EXPECT_EQ(pSumoObsGetPrev(ab, b), bc);
    EXPECT_TRUE(fails_with(pSumoObsGetNext(ab, c), PLX_ERROR_INCOMPATIBLE));
    EXPECT_EQ(uiSumoStateVectorObsListSize(b), 2u);
    EXPECT_EQ(uiSumoStateVectorObsListSize(c), 1u);

    // A state listed twice is refused and nothing is linked.
    Vec z{0.0, 0.0};
    Squ N(2, 1.0);
    SumoStateVector *twice[3] = {a, c, a};
    EXPECT_EQ(pSumoObsH(m.sumo.get(), &z.v, &N.m, h_difference, nullptr, twice, 3), nullptr);
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_EQ(uiSumoStateVectorObsListSize(a), 1u);
    EXPECT_EQ(m.sumo->obs_active, bc);
    // The same through the argument form; a null slot in an array is skipped.
    EXPECT_EQ(pSumoObsH_va(m.sumo.get(), &z.v, &N.m, h_difference, nullptr, c, c, nullptr), nullptr);
    SumoObs *va = pSumoObsH_va(m.sumo.get(), &z.v, &N.m, h_difference, nullptr, c, a, nullptr);
    ASSERT_NE(va, nullptr);
    EXPECT_EQ(va->n_states, 2u);
    EXPECT_EQ(va->states[1], a);
    SumoStateVector *with_null[2] = {nullptr, c};
    SumoObs *single = pSumoObsH(m.sumo.get(), &z.v, &N.m, h_difference, nullptr, with_null, 2);
    ASSERT_NE(single, nullptr);
    EXPECT_EQ(c->obs_active, single);
    EXPECT_EQ(uiSumoStateVectorObsListSize(c), 3u);

    // Swapping slots keeps every list walkable.
    ASSERT_TRUE(bSumoObsSwapStates(va, 0, 1));
    EXPECT_EQ(va->states[0], a);
    EXPECT_EQ(uiSumoStateVectorObsListSize(a), 2u);
    EXPECT_EQ(uiSumoStateVectorObsListSize(c), 3u);
    EXPECT_FALSE(bSumoObsSwapStates(va, 0, 2));

    // Deleting unlinks from every list.
    ASSERT_TRUE(bSumoObsDelete(m.sumo.get(), m.ws.get(), bc, nullptr));
    EXPECT_EQ(uiSumoStateVectorObsListSize(b), 1u);
    EXPECT_EQ(uiSumoStateVectorObsListSize(c), 2u);
    ASSERT_TRUE(bSumoObsDelete(m.sumo.get(), m.ws.get(), va, nullptr));
    EXPECT_EQ(uiSumoStateVectorObsListSize(a), 1u);
    EXPECT_EQ(c->obs_active, single);
}

TEST(SumoModel, RobustKindsAndOverwrite)
{
    Model m;
    SumoStateVector *a = m.state(m.sumo->root, 2);
    Vec z{3.0, 4.0};  // chi-squared 25 at x = 0 with unit information
    Squ N(2, 1.0);
    SumoStateVector *st[1] = {a};
    SumoObs *o = pSumoObsH(m.sumo.get(), &z.v, &N.m, h_identity, nullptr, st, 1);
    ASSERT_NE(o, nullptr);
    // De-robustifying a plain observation does nothing.
    ASSERT_TRUE(bSumoObs_DeRobustify(m.sumo.get(), o));
    EXPECT_EQ(o->kind, SUMO_OBS_H);
    // Exactly at the cutoff it stays an inlier.
    ASSERT_TRUE(bSumoObs_Robustify(m.sumo.get(), m.ws.get(), o, 4.0, 25.0));
    EXPECT_EQ(o->kind, SUMO_OBS_H_ROBUST);
    EXPECT_EQ(o->outlier, 0u);
    EXPECT_DOUBLE_EQ(o->chi2_offset, 0.75 * 25.0);
    EXPECT_DOUBLE_EQ(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), 25.0);
    // The cost is continuous across the cutoff: just above it, chi2/s + offset.
    ASSERT_TRUE(bSumoObs_Robustify(m.sumo.get(), m.ws.get(), o, 4.0, 25.0 - 1e-9));
    EXPECT_EQ(o->outlier, 1u);
    EXPECT_NEAR(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), 25.0, 1e-8);
    ASSERT_TRUE(bSumoObs_Robustify(m.sumo.get(), m.ws.get(), o, 4.0, 9.0));
    EXPECT_DOUBLE_EQ(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), 25.0 / 4.0 + 0.75 * 9.0);
    // Weight multiplies the cost; overwriting resets it.
    o->weight = 2.0;
    EXPECT_DOUBLE_EQ(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), 2.0 * (25.0 / 4.0 + 0.75 * 9.0));
    Vec z2{1.0, 0.0};
    m.sumo->modified = 0;
    ASSERT_TRUE(bSumoObsH_Overwrite(m.sumo.get(), o, &z2.v, nullptr));
    EXPECT_EQ(o->weight, 1.0);
    EXPECT_EQ(m.sumo->modified, 1u);
    EXPECT_DOUBLE_EQ(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), 1.0);
    EXPECT_EQ(o->outlier, 0u);
    EXPECT_TRUE(fails_with(bSumoObsF_Overwrite(m.sumo.get(), o, &z2.v, nullptr), PLX_ERROR_INCOMPATIBLE));
    Vec z3{1.0, 0.0, 0.0};
    EXPECT_FALSE(bSumoObsH_Overwrite(m.sumo.get(), o, &z3.v, nullptr));
    ASSERT_TRUE(bSumoObs_DeRobustify(m.sumo.get(), o));
    EXPECT_EQ(o->kind, SUMO_OBS_H);

    // Unknown kinds.
    o->kind = 9;
    EXPECT_TRUE(fails_with(bSumoObs_DeRobustify(m.sumo.get(), o), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoObs_Robustify(m.sumo.get(), m.ws.get(), o, 4.0, 9.0), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_EQ(dSumoObsComputeResidual(m.sumo.get(), m.ws.get(), o), SUMO_FAILED_RESIDUAL);
    EXPECT_EQ(error_code(), PLX_ERROR_ILLEGAL_TYPE);
    o->kind = SUMO_OBS_H;
}

TEST(SumoModel, BranchAndStateRemovalRules)
{
    Model m;
    SumoBranch *root = m.sumo->root;
    SumoStateVector *a = m.state(root, 2), *b = m.state(root, 2);
    SumoBranch *sub = pSumoBranchNewFromBranch(m.sumo.get(), root);
    SumoStateVector *s = m.state(sub, 2);
    SumoObs *o = m.link(a, b);
    ASSERT_TRUE(o);

    EXPECT_TRUE(fails_with(bSumoBranchDelete(m.sumo.get(), sub), PLX_ERROR_INCOMPATIBLE));
    EXPECT_EQ(root->sub, sub);
    // Observations, parameters or a hanging branch keep a state.
    EXPECT_TRUE(fails_with(bSumoStateDelete(m.sumo.get(), m.ws.get(), a, nullptr), PLX_ERROR_INCOMPATIBLE));
    EXPECT_FALSE(bSumoStateDelete(m.sumo.get(), m.ws.get(), s, nullptr));
    ASSERT_TRUE(bSumoStateVectorUninit(m.sumo.get(), s, nullptr));
    SumoBranch *hang = pSumoBranchNewFromState(m.sumo.get(), s);
    ASSERT_NE(hang, nullptr);
    EXPECT_EQ(pSumoBranchNewFromState(m.sumo.get(), s), nullptr);
    EXPECT_FALSE(bSumoStateDelete(m.sumo.get(), m.ws.get(), s, nullptr));
    ASSERT_TRUE(bSumoBranchDelete(m.sumo.get(), hang));
    EXPECT_EQ(s->sub_branch, nullptr);
    ASSERT_TRUE(bSumoStateDelete(m.sumo.get(), m.ws.get(), s, nullptr));
    EXPECT_EQ(sub->first, nullptr);
    ASSERT_TRUE(bSumoBranchDelete(m.sumo.get(), sub));
    EXPECT_EQ(root->sub, nullptr);

    // A branch of unknown kind is refused and left in place.
    SumoBranch *odd = pSumoBranchNewFromBranch(m.sumo.get(), root);
    odd->kind = 7;
    EXPECT_TRUE(fails_with(bSumoBranchDelete(m.sumo.get(), odd), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_EQ(root->sub, odd);
    odd->kind = SUMO_BRANCH_FROM_BRANCH;

    // An observation on an uninitialised state is skipped by the solver and cannot be
    // eliminated.
    ASSERT_TRUE(bSumoStateVectorUninit(m.sumo.get(), b, nullptr));
    EXPECT_TRUE(fails_with(bSumoObsEliminate(m.sumo.get(), m.ws.get(), o, nullptr), PLX_ERROR_NOT_INITIALISED));
    EXPECT_EQ(m.sumo->obs_active, o);
    EXPECT_EQ(o->eliminated, 0u);
    // Deleting an observation frees its state to be deleted too.
    ASSERT_TRUE(bSumoObsDelete(m.sumo.get(), m.ws.get(), o, nullptr));
    ASSERT_TRUE(bSumoStateDelete(m.sumo.get(), m.ws.get(), b, nullptr));
    EXPECT_EQ(root->last, a);
}

TEST(SumoModel, OffDiagonalBlocksAreSortedAndSkipEmptyStates)
{
    Model m;
    SumoBranch *root = m.sumo->root;
    SumoStateVector *a = m.state(root, 2), *b = m.state(root, 3), *c = m.state(root, 2);
    SumoStateVector *fixed = m.state(root, 0);
    SumoStateVector *s3[3] = {c, fixed, a};
    // h_identity measures the first state, so z takes that state's dimension.
    Vec z2{0.0, 0.0};
    Squ N2(2, 1.0);
    ASSERT_NE(pSumoObsH(m.sumo.get(), &z2.v, &N2.m, h_identity, nullptr, s3, 3), nullptr);
    SumoStateVector *s2[2] = {b, a};
    Vec z3{0.0, 0.0, 0.0};
    Squ N3(3, 1.0);
    ASSERT_NE(pSumoObsH(m.sumo.get(), &z3.v, &N3.m, h_identity, nullptr, s2, 2), nullptr);
    uint32_t f, l;
    ASSERT_TRUE(bSumoCreateOffdiagBlocksBranch(m.sumo.get(), root, &f, &l));
    EXPECT_EQ(f, 0u);
    EXPECT_EQ(l, 0xFFFFFFFFu);
    // a is first in order: it is the row of both blocks, sorted by column index.
    ASSERT_NE(a->row_blocks, nullptr);
    EXPECT_EQ(a->row_blocks->col, b);
    EXPECT_EQ(a->row_blocks->M.rows, 2u);
    EXPECT_EQ(a->row_blocks->M.cols, 3u);
    ASSERT_NE(a->row_blocks->row_next, nullptr);
    EXPECT_EQ(a->row_blocks->row_next->col, c);
    EXPECT_EQ(a->row_blocks->row_next->row_next, nullptr);
    EXPECT_EQ(fixed->row_blocks, nullptr);
    EXPECT_EQ(fixed->col_blocks, nullptr);
    EXPECT_EQ(b->col_blocks, a->row_blocks);
    SumoOffdiag *found = nullptr;
    ASSERT_TRUE(bSumoOffdiagSearchGen(m.sumo.get(), a, c, 0, nullptr, nullptr, &found));
    EXPECT_EQ(found, a->row_blocks->row_next);
    ASSERT_TRUE(bSumoOffdiagSearchGen(m.sumo.get(), b, c, 0, nullptr, nullptr, &found));
    EXPECT_EQ(found, nullptr);
    ASSERT_TRUE(bSumoOffdiagSearchGen(m.sumo.get(), a, fixed, 1, nullptr, nullptr, &found));
    EXPECT_EQ(found, nullptr);

    // Moving a to the end turns it into the column of both blocks (transposed).
    a->row_blocks->M.data[1] = 5.0;  // element (0, 1) of the a-b block
    ASSERT_TRUE(bSumoStateVectorMoveBranch(m.sumo.get(), m.ws.get(), a, root));
    EXPECT_EQ(root->last, a);
    EXPECT_GT(a->index, c->index);
    EXPECT_EQ(a->row_blocks, nullptr);
    ASSERT_NE(b->row_blocks, nullptr);
    EXPECT_EQ(b->row_blocks->col, a);
    EXPECT_EQ(b->row_blocks->M.rows, 3u);
    EXPECT_EQ(b->row_blocks->M.data[1 * 2 + 0], 5.0);  // now element (1, 0)
    EXPECT_EQ(c->row_blocks->col, a);
    int in_a = 0;
    for (SumoOffdiag *k = a->col_blocks; k != nullptr; k = k->col_next, ++in_a) EXPECT_EQ(k->col, a);
    EXPECT_EQ(in_a, 2);
    // A state cannot be moved under itself.
    SumoBranch *hang = pSumoBranchNewFromState(m.sumo.get(), b);
    EXPECT_TRUE(fails_with(bSumoStateVectorMoveBranch(m.sumo.get(), m.ws.get(), b, hang), PLX_ERROR_INCOMPATIBLE));
}

void *copy_int(void *p)
{
    int *c = static_cast<int *>(std::malloc(sizeof(int)));
    if (c != nullptr) *c = *static_cast<int *>(p);
    return c;
}

TEST(SumoModel, CopyRebuildsTreeObservationsAndUserData)
{
    Model m;
    SumoBranch *root = m.sumo->root;
    SumoStateVector *a = m.state(root, 2), *b = m.state(root, 2);
    SumoBranch *hang = pSumoBranchNewFromState(m.sumo.get(), b);
    SumoStateVector *h = m.state(hang, 2);
    m.state(root, 1, false);
    a->x.v.data[0] = 1.5;
    a->x.label = 17;
    a->A.data[0] = 2.0;
    a->x.user_data = std::malloc(sizeof(int));
    *static_cast<int *>(a->x.user_data) = 42;
    a->x.user_free = std::free;
    a->x.user_copy = copy_int;
    SumoObs *o1 = m.link(a, h);
    SumoObs *o2 = m.link(h, b);
    ASSERT_TRUE(o1 && o2);
    ASSERT_TRUE(bSumoObs_Robustify(m.sumo.get(), m.ws.get(), o2, 3.0, 2.0));
    o1->numeric_jacobians = 1;
    o1->z.label = 5;

    SumoPtr c{pSumoCopy(m.sumo.get(), nullptr, nullptr, nullptr)};
    ASSERT_NE(c, nullptr);
    SumoStateVector *ca = c->root->first;
    ASSERT_NE(ca, nullptr);
    SumoStateVector *cb = ca->next;
    ASSERT_NE(cb, nullptr);
    ASSERT_NE(cb->sub_branch, nullptr);
    SumoStateVector *ch = cb->sub_branch->first;
    EXPECT_EQ(cb->next->status, SUMO_STATE_UNINITIALISED);
    EXPECT_EQ(ca->x.v.data[0], 1.5);
    EXPECT_EQ(ca->x.label, 17);
    EXPECT_EQ(ca->A.data[0], 2.0);
    ASSERT_NE(ca->x.user_data, a->x.user_data);
    EXPECT_EQ(*static_cast<int *>(ca->x.user_data), 42);
    // Same observation order, on the copied states, with their settings.
    SumoObs *c2 = c->obs_active, *c1 = c2->next;
    ASSERT_TRUE(c1 && c2);
    EXPECT_EQ(c1->states[0], ca);
    EXPECT_EQ(c1->states[1], ch);
    EXPECT_EQ(c1->numeric_jacobians, 1u);
    EXPECT_EQ(c1->z.label, 5);
    EXPECT_EQ(c2->kind, SUMO_OBS_H_ROBUST);
    EXPECT_EQ(c2->chi2_cutoff, 2.0);
    EXPECT_EQ(uiSumoStateVectorObsListSize(ch), 2u);
    ASSERT_TRUE(bSumoSetStateIndices(m.sumo.get()));
    ASSERT_TRUE(bSumoSetStateIndices(c.get()));
    EXPECT_EQ(ch->index, h->index);
    EXPECT_EQ(cb->index, b->index);

    // Owned user data that cannot be copied stops the copy.
    a->x.user_copy = nullptr;
    EXPECT_TRUE(fails_with(pSumoCopy(m.sumo.get(), nullptr, nullptr, nullptr), PLX_ERROR_INCOMPATIBLE));
    a->x.user_copy = copy_int;
}

TEST(SumoModel, MemoryStackRecordsAndClones)
{
    Plx_MemoryStack *ms = plx_memory_stack_form(nullptr, 0, 1 << 16);
    ASSERT_NE(ms, nullptr);
    {
        Model m;
        SumoStateVector *a = pSumoStateVectorNew(m.sumo.get(), m.sumo->root, 3, ms, nullptr);
        SumoStateVector *b = pSumoStateVectorNew(m.sumo.get(), m.sumo->root, 3, ms, nullptr);
        ASSERT_TRUE(a && b);
        EXPECT_EQ(a->owned, 0u);
        Vec x0{1.0, 2.0, 3.0};
        ASSERT_TRUE(bSumoStateVectorInit(m.sumo.get(), a, &x0.v));
        ASSERT_TRUE(bSumoStateVectorInit(m.sumo.get(), b, nullptr));
        EXPECT_EQ(a->x.v.data[2], 3.0);
        Vec z{0.0, 0.0, 0.0};
        Squ N(3, 1.0);
        SumoObs *o = pSumoObsH_va(m.sumo.get(), &z.v, &N.m, h_difference, ms, a, b, nullptr);
        ASSERT_NE(o, nullptr);
        EXPECT_EQ(o->owned, 0u);
        Vec wrong{1.0};
        EXPECT_TRUE(fails_with(bSumoStateVectorInit(m.sumo.get(), b, &wrong.v), PLX_ERROR_INCOMPATIBLE));

        // A clone loses its observations and points at what it clones, through clones.
        SumoStateVector *c = m.state(m.sumo->root, 3);
        ASSERT_TRUE(bSumoStateVectorInitClone(m.sumo.get(), m.ws.get(), b, a, nullptr));
        EXPECT_EQ(b->x.type, SUMO_TYPE_CLONE);
        EXPECT_EQ(b->x.user_data, a);
        EXPECT_EQ(b->obs_active, nullptr);
        EXPECT_EQ(a->obs_active, nullptr);
        EXPECT_EQ(b->x.v.data[0], 0.0);
        ASSERT_TRUE(bSumoStateVectorInitClone(m.sumo.get(), m.ws.get(), c, b, nullptr));
        EXPECT_EQ(c->x.user_data, a);
    }
    plx_memory_stack_free(ms);
}

}  // namespace
