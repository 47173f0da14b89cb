// The reusable build of the root branch. After a rejected Levenberg-Marquardt step the
// parameters are put back, so the next iteration's build would repeat the previous one
// exactly: the observations are evaluated at the same parameters. The last build is kept (the
// work blocks it writes, before damping) and restored instead when nothing it depends on
// changed: the same index limits, the same active states and blocks in the same order, the
// same parameters and fixed priors, and no observation added, removed or changed through the
// optimiser since (the rule under which the cached cost survives).
#include <new>
#include <vector>

#include "sumo/sumo_internal.hpp"

namespace sumo {

struct BuildCache {
    uint32_t first = 0, last = 0;
    std::vector<SumoStateVector *> states;
    std::vector<SumoOffdiag *> blocks;
    std::vector<double> key;    // per state x, A, b; per block M
    std::vector<double> built;  // per state A_work, b_work; per block M_work
};

namespace {

template <class F>
void for_each_active(Sumo *sumo, F &&f)
{
    auto visit = [&](SumoStateVector *s) {
        if (is_active(s)) f(s);
        return true;
    };
    walk_branch(sumo->root, visit);
}

void append(std::vector<double> &v, const double *p, std::size_t n) { v.insert(v.end(), p, p + n); }

std::size_t square(const SumoStateVector *s) { return std::size_t(dim(s)) * dim(s); }
// What a build with these limits writes: the states up to `last` and their blocks whose
// column is up to `last`.
bool built(const SumoStateVector *s, uint32_t last) { return last == kAll || s->index <= last; }
std::size_t cells(const SumoOffdiag *k) { return std::size_t(k->M.rows) * k->M.cols; }

}  // namespace

void build_cache_drop(Sumo *sumo)
{
    delete static_cast<BuildCache *>(sumo->build_cache);
    sumo->build_cache = nullptr;
}

void build_cache_take(Sumo *sumo, uint32_t first, uint32_t last)
{
    auto *c = static_cast<BuildCache *>(sumo->build_cache);
    if (c == nullptr) {
        c = new (std::nothrow) BuildCache;
        if (c == nullptr) return;
        sumo->build_cache = c;
    }
    try {
        c->first = first;
        c->last = last;
        c->states.clear();
        c->blocks.clear();
        c->key.clear();
        c->built.clear();
        // Every active state's parameters and priors are in the key (observations reach
        // beyond the limits); only what the build wrote is kept.
        for_each_active(sumo, [&](SumoStateVector *s) {
            c->states.push_back(s);
            append(c->key, s->x.v.data, dim(s));
            append(c->key, s->A.data, square(s));
            append(c->key, s->b.data, dim(s));
            for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
                c->blocks.push_back(k);
                append(c->key, k->M.data, cells(k));
            }
            if (!built(s, last)) return;
            append(c->built, s->A_work.data, square(s));
            append(c->built, s->b_work.data, dim(s));
            for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
                if (built(k->col, last)) append(c->built, k->M_work.data, cells(k));
        });
    } catch (const std::bad_alloc &) {
        build_cache_drop(sumo);
    }
}

bool build_cache_restore(Sumo *sumo, uint32_t first, uint32_t last)
{
    const auto *c = static_cast<const BuildCache *>(sumo->build_cache);
    if (c == nullptr || c->first != first || c->last != last) return false;
    // The whole key is checked before anything is written.
    std::size_t si = 0, bi = 0, at = 0;
    bool same = true;
    auto equal = [&](const double *p, std::size_t n) {
        same = same && at + n <= c->key.size() && std::memcmp(p, c->key.data() + at, sizeof(double) * n) == 0;
        at += n;
    };
    for_each_active(sumo, [&](SumoStateVector *s) {
        same = same && si < c->states.size() && c->states[si++] == s;
        if (!same) return;
        equal(s->x.v.data, dim(s));
        equal(s->A.data, square(s));
        equal(s->b.data, dim(s));
        for (SumoOffdiag *k = s->row_blocks; same && k != nullptr; k = k->row_next) {
            same = bi < c->blocks.size() && c->blocks[bi++] == k;
            if (same) equal(k->M.data, cells(k));
        }
    });
    if (!same || si != c->states.size() || bi != c->blocks.size() || at != c->key.size()) return false;
    const double *from = c->built.data();
    auto take = [&](double *p, std::size_t n) {
        if (n > 0) std::memcpy(p, from, sizeof(double) * n);
        from += n;
    };
    for (SumoStateVector *s : c->states) {
        if (!built(s, last)) continue;
        take(s->A_work.data, square(s));
        s->A_work.type = PLX_SQUMAT_SYMMETRIC;
        take(s->b_work.data, dim(s));
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
            if (built(k->col, last)) take(k->M_work.data, cells(k));
    }
    return true;
}

}  // namespace sumo
