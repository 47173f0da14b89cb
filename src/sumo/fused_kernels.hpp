// Fused evaluation of h-type observations. An h function may be paired with a kernel that
// predicts the observation and forms its normal-equation terms in the same pass, so that
// observations with thousands of rows (image blocks) never write out their Jacobians. The
// optimiser uses the kernel whenever the observation's information matrix is diagonal or a
// scaled identity and its Jacobians are analytic; everything else (robust decisions, outlier
// scaling, where the terms are added) stays the optimiser's.
#ifndef PLANO_SRC_SUMO_FUSED_KERNELS_HPP
#define PLANO_SRC_SUMO_FUSED_KERNELS_HPP

#include <cstdint>
#include <unordered_map>
#include <vector>

#include "plano/sumo.h"

namespace sumo {

// Largest summed dimension of an observation's states that a kernel may be asked for.
constexpr uint32_t kFusedMaxParams = 16;

// Writes chi2 = r^T N r (r = z - h) and, when jtnj is not null, J^T N J (n x n, both
// triangles, row-major) and J^T N r (n) into jtnj and jtnr, where J stacks the Jacobians of
// the observation's states in order (n = sum of their dimensions, a null state counting 0).
// N is diagonal with entry r at info[r * info_step] (step 0: a scaled identity). A kernel may
// decline an observation it cannot take (the general path then evaluates it); a failure is
// registered as the h function would register it.
enum class FusedResult { done, failed, declined };
using FusedHKernel = FusedResult (*)(SumoStateVector **states, uint32_t n_states, const SumoVector *z,
                                     const double *info, uint32_t info_step, double *chi2, double *jtnj,
                                     double *jtnr);

// Pairs a kernel with an h function. Registration happens while the library loads (static
// initialisers), before any optimiser runs; at most 32 pairs.
bool register_fused_h(SumoHFunction h, FusedHKernel kernel);
// The kernel paired with h, or null.
FusedHKernel fused_h(SumoHFunction h);

// One observation's kernel terms with Jacobians for a range of states: where each state's
// rows start in the stacked matrices and whether they are wanted.
struct FusedTerms {
    double chi2;
    uint32_t n_total;
    bool any;
    uint32_t offset[8];
    bool want[8];
    double jtnr[kFusedMaxParams];
    double jtnj[kFusedMaxParams * kFusedMaxParams];
};
// Whether the optimiser evaluates the observation through a kernel (h type, analytic
// Jacobians, diagonal information, a kernel paired with its function).
bool has_fused_kernel(const SumoObs *obs);
// Writes the terms when the observation has a kernel that takes it; false otherwise (also
// on a kernel failure, which the evaluation then meets and reports itself).
bool fused_terms_of(SumoObs *obs, uint32_t first, uint32_t last, FusedTerms *terms);

// Terms computed ahead of a build for the Jacobian limits [first, last]; the evaluation
// takes an observation's terms from here when done[i] is set (Sumo::fused_ahead).
struct FusedAhead {
    uint32_t first = 0, last = 0;
    std::unordered_map<const SumoObs *, uint32_t> index;
    std::vector<FusedTerms> terms;
    std::vector<uint8_t> done;
};
// With a threaded host and enough rows, computes the terms of the candidates that have a
// kernel, over all jobs, into `ahead` and hands it to the optimiser (Sumo::fused_ahead) for
// the evaluation that follows at the same parameters. False only when the jobs fail.
bool terms_ahead_of(Sumo *sumo, const std::vector<SumoObs *> &candidates, uint32_t first, uint32_t last,
                    const ThreadHostInterface *host, const char *function, FusedAhead &ahead);
// Takes the terms back from the optimiser when it goes out of scope; declared after the
// table, so that the optimiser lets go of it first.
struct AheadInUse {
    Sumo *sumo;
    explicit AheadInUse(Sumo *s) : sumo(s) {}
    ~AheadInUse() { sumo->fused_ahead = nullptr; }
    AheadInUse(const AheadInUse &) = delete;
    AheadInUse &operator=(const AheadInUse &) = delete;
};

}  // namespace sumo

#endif
