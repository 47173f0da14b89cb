// The optimiser record: forming, freeing, deep copies, workspaces and SumoVectors.
#include <cstdlib>
#include <unordered_map>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

using StateMap = std::unordered_map<const SumoStateVector *, SumoStateVector *>;

void map_states(const SumoBranch *src, const SumoBranch *dst, StateMap &map)
{
    if (src == nullptr || dst == nullptr) return;
    for (const SumoStateVector *s = src->first, *d = dst->first; s != nullptr && d != nullptr;
         s = s->next, d = d->next) {
        map[s] = const_cast<SumoStateVector *>(d);
        map_states(s->sub_branch, d->sub_branch, map);
    }
    map_states(src->sub, dst->sub, map);
}

// Rebuilds one observation of the source on the copied states.
bool copy_obs(Sumo *dst, const SumoObs *o, const StateMap &map, Plx_MemoryStack *ms)
{
    SumoStateVector *states[64];
    SumoStateVector **st = states;
    plx::HeapPtr<SumoStateVector *> heap;
    if (o->n_states > 64) {
        heap.reset(PLX_ALLOC(SumoStateVector *, o->n_states));
        if (!heap) return false;
        st = heap.get();
    }
    for (uint32_t i = 0; i < o->n_states; ++i) {
        if (o->states[i] == nullptr) {
            st[i] = nullptr;
            continue;
        }
        auto it = map.find(o->states[i]);
        if (it == map.end()) {
            PLX_ERR_START_AS("pSumoCopy", PLX_ERROR_INCOMPATIBLE, "observation on a state outside the branch tree", 0);
            return false;
        }
        st[i] = it->second;
    }
    const bool robust = o->kind == SUMO_OBS_H_ROBUST || o->kind == SUMO_OBS_F_ROBUST;
    SumoObs *c;
    if (o->kind == SUMO_OBS_H || o->kind == SUMO_OBS_H_ROBUST)
        c = robust ? pSumoObsHRobust(dst, &o->z.v, &o->N, o->func.h, o->variance_scaling, o->chi2_cutoff, ms, st,
                                     o->n_states)
                   : pSumoObsH(dst, &o->z.v, &o->N, o->func.h, ms, st, o->n_states);
    else
        c = robust ? pSumoObsFRobust(dst, &o->z.v, &o->N, o->func.F, o->variance_scaling, o->chi2_cutoff, ms, st,
                                     o->n_states)
                   : pSumoObsF(dst, &o->z.v, &o->N, o->func.F, ms, st, o->n_states);
    if (c == nullptr) return false;
    if (!bSumoVectorCopy(&o->z, &c->z)) return false;
    c->chi2_offset = o->chi2_offset;
    c->weight = o->weight;
    c->numeric_jacobians = o->numeric_jacobians;
    c->outlier = o->outlier;
    c->store_states = o->store_states;
    c->io_tag = o->io_tag;
    return true;
}

// Copies the fixed blocks between states of the source onto the copies.
bool copy_blocks(Sumo *dst, const StateMap &map)
{
    for (const auto &[src, copy] : map) {
        for (SumoOffdiag *k = src->row_blocks; k != nullptr; k = k->row_next) {
            auto it = map.find(k->col);
            if (it == map.end()) continue;
            SumoOffdiag *blk;
            bool copy_row;
            if (!block_between(dst, copy, it->second, true, &blk, &copy_row)) return false;
            if (blk == nullptr) continue;
            if (copy_row) {
                std::memcpy(blk->M.data, k->M.data, sizeof(double) * k->M.rows * k->M.cols);
            } else {
                for (uint32_t i = 0; i < k->M.rows; ++i)
                    for (uint32_t j = 0; j < k->M.cols; ++j)
                        blk->M.data[std::size_t(j) * k->M.rows + i] = k->M.data[std::size_t(i) * k->M.cols + j];
            }
        }
    }
    return true;
}

template <class Entry>
void *copy_io_entry(const void *entry)
{
    void *c = std::malloc(sizeof(Entry));
    if (c != nullptr) std::memcpy(c, entry, sizeof(Entry));
    return c;
}

}  // namespace

extern "C" {

PLANO_API Sumo *pSumoForm(Sumo *sumo, const ThreadHostInterface *host)
{
    bool owned = false;
    if (sumo == nullptr) {
        sumo = PLX_ALLOC(Sumo, 1);
        if (sumo == nullptr) return nullptr;
        owned = true;
    }
    std::memset(sumo, 0, sizeof(*sumo));
    sumo->root = pSumoBranchRoot();
    if (sumo->root == nullptr) {
        PLX_ERR_PASS();
        if (owned) std::free(sumo);
        return nullptr;
    }
    sumo->owned = owned ? 1u : 0u;
    sumo->indices_valid = 1;
    sumo->modified = 1;
    sumo->n_threads = (host != nullptr && host->thread_count != nullptr)
                          ? host->thread_count(host->thread_count_context)
                          : 0u;
    return sumo;
}

PLANO_API void vSumoFree(Sumo *sumo, const ThreadHostInterface *host)
{
    if (sumo == nullptr) return;
    if (sumo->state_io != nullptr) plx_list_free(sumo->state_io, std::free);
    if (sumo->obs_io != nullptr) plx_list_free(sumo->obs_io, std::free);
    sumo->state_io = sumo->obs_io = nullptr;
    if (sumo->user_free != nullptr && sumo->user_data != nullptr) sumo->user_free(sumo->user_data);
    sumo->user_data = nullptr;
    vSumoStateVectorListFree(sumo, sumo->elim_last, host);
    sumo->elim_last = sumo->elim_first = nullptr;
    vSumoBranchFree(sumo, sumo->root, host);
    sumo->root = nullptr;
    vSumoObsListFree(sumo->obs_active);
    vSumoObsListFree(sumo->obs_eliminated);
    sumo->obs_active = sumo->obs_eliminated = nullptr;
    free_job_workspaces(sumo);
    build_cache_drop(sumo);
    if (sumo->owned) std::free(sumo);
}

PLANO_API SumoWorkspace *pSumoWorkspaceForm(SumoWorkspace *workspace)
{
    bool owned = false;
    if (workspace == nullptr) {
        workspace = PLX_ALLOC(SumoWorkspace, 1);
        if (workspace == nullptr) return nullptr;
        owned = true;
    }
    std::memset(workspace, 0, sizeof(*workspace));
    workspace->owned = owned ? 1u : 0u;
    return workspace;
}

PLANO_API void vSumoWorkspaceFree(SumoWorkspace *workspace)
{
    if (workspace == nullptr) return;
    for (uint32_t i = 0; i < workspace->capacity; ++i) {
        plx_mat_free(&workspace->jacobians[i]);
        plx_mat_free(&workspace->nj[i]);
    }
    std::free(workspace->jacobians);
    std::free(workspace->nj);
    std::free(workspace->jacobian_ptrs);
    plx_vec_free(&workspace->residual);
    plx_mat_free(&workspace->Fz);
    plx_vec_free(&workspace->h);
    plx_squmat_free(&workspace->N_eff);
    plx_mat_free(&workspace->mat);
    plx_squmat_free(&workspace->squ);
    plx_vec_free(&workspace->vec);
    const bool owned = workspace->owned != 0;
    std::memset(workspace, 0, sizeof(*workspace));
    if (owned) std::free(workspace);
}

PLANO_API Sumo *pSumoCopy(const Sumo *source, Sumo *dest, Plx_MemoryStack *ms, const ThreadHostInterface *host)
{
    if (source == nullptr || source->root == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    if (source->user_data != nullptr && source->user_free != nullptr && source->user_copy == nullptr) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "user data without a copy function", 0);
        return nullptr;
    }
    Sumo *c = pSumoForm(dest, host);
    if (c == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    // The copy keeps the source's thread count, so per-thread accumulators match its jobs.
    c->n_threads = host != nullptr ? c->n_threads : source->n_threads;
    bool ok = false;
    try {
        StateMap map;
        ok = bSumoBranchCopy(c, c->root, source->root, ms, host) != 0;
        if (ok) {
            map_states(source->root, c->root, map);
            ok = bSumoSetStateIndices(c) && copy_blocks(c, map);
        }
        if (ok) {
            const SumoObs *oldest = source->obs_active;
            while (oldest != nullptr && oldest->next != nullptr) oldest = oldest->next;
            for (const SumoObs *o = oldest; ok && o != nullptr; o = o->prev) ok = copy_obs(c, o, map, ms);
        }
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "state map", 0);
        ok = false;
    }
    if (ok && source->obs_io != nullptr) {
        c->obs_io = plx_list_copy(source->obs_io, nullptr, copy_io_entry<SumoObsIORegistration>, std::free);
        ok = c->obs_io != nullptr;
    }
    if (ok && source->state_io != nullptr) {
        c->state_io = plx_list_copy(source->state_io, nullptr, copy_io_entry<SumoStateIORegistration>, std::free);
        ok = c->state_io != nullptr;
    }
    if (ok) {
        c->io_header_read = source->io_header_read;
        c->io_header_write = source->io_header_write;
        c->io_header_arg = source->io_header_arg;
        c->user_free = source->user_free;
        c->user_copy = source->user_copy;
        if (source->user_data != nullptr) {
            if (source->user_free == nullptr) {
                c->user_data = source->user_data;
            } else {
                c->user_data = source->user_copy(source->user_data);
                if (c->user_data == nullptr) {
                    PLX_ERR_START(PLX_ERROR_CALLEE, "user data copy failed", 0);
                    ok = false;
                }
            }
        }
    }
    if (!ok) {
        PLX_ERR_PASS();
        vSumoFree(c, host);
        return nullptr;
    }
    c->modified = 1;
    return c;
}

// ---- vectors ----

PLANO_API SumoVector *pSumoVectorForm(SumoVector *vector, uint32_t size, Plx_MemoryStack *ms)
{
    bool owned = false;
    if (vector == nullptr) {
        vector = static_cast<SumoVector *>(alloc_zero(ms, sizeof(SumoVector), __func__));
        if (vector == nullptr) return nullptr;
        owned = ms == nullptr;
    }
    std::memset(vector, 0, sizeof(*vector));
    if (!form_vec(&vector->v, size, ms, __func__)) {
        if (owned) std::free(vector);
        return nullptr;
    }
    vector->type = SUMO_UNSET_LABEL;
    vector->label = SUMO_UNSET_LABEL;
    vector->owned = owned ? 1u : 0u;
    return vector;
}

PLANO_API Plx_Bool bSumoVectorCopy(const SumoVector *source, SumoVector *dest)
{
    if (source == nullptr || dest == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (source == dest) return PLX_TRUE;
    if (source->v.rows != dest->v.rows) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "vector sizes differ", int64_t(source->v.rows));
        return PLX_FALSE;
    }
    void *data = source->user_data;
    if (data != nullptr && source->user_free != nullptr) {
        if (source->user_copy == nullptr) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "user data without a copy function", 0);
            return PLX_FALSE;
        }
        data = source->user_copy(source->user_data);
        if (data == nullptr) {
            PLX_ERR_START(PLX_ERROR_CALLEE, "user data copy failed", 0);
            return PLX_FALSE;
        }
    }
    if (dest->user_free != nullptr && dest->user_data != nullptr) dest->user_free(dest->user_data);
    if (source->v.rows > 0) std::memcpy(dest->v.data, source->v.data, sizeof(double) * source->v.rows);
    dest->type = source->type;
    dest->label = source->label;
    dest->user_data = data;
    dest->user_free = source->user_free;
    dest->user_copy = source->user_copy;
    return PLX_TRUE;
}

PLANO_API SumoVector *pSumoVectorCopy(const SumoVector *source, SumoVector *dest, Plx_MemoryStack *ms)
{
    if (source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    SumoVector *c = pSumoVectorForm(dest, source->v.rows, ms);
    if (c == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (!bSumoVectorCopy(source, c)) {
        PLX_ERR_PASS();
        vSumoVectorFree(c);
        return nullptr;
    }
    return c;
}

PLANO_API void vSumoVectorFree(SumoVector *vector)
{
    if (vector == nullptr) return;
    if (vector->user_free != nullptr && vector->user_data != nullptr) vector->user_free(vector->user_data);
    vector->user_data = nullptr;
    plx_vec_free(&vector->v);
    if (vector->owned) std::free(vector);
}

}  // extern "C"
