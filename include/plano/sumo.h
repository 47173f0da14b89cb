/* Sumo: a sparse nonlinear least-squares optimiser.
 *
 * A problem is a set of state vectors (the unknowns, each a small dense vector) and
 * observations (measurements depending on one or more states), each observation adding a
 * Gaussian term to the cost. The information matrix is block-sparse: one dense block per
 * state on the diagonal (A), one dense block per pair of states that share an observation
 * (SumoOffdiag). States hang on branches; the branch tree fixes the elimination order:
 * for a branch, its `sub` chain first (deepest branch first), then its states in list order,
 * a state's hanging branch just before the state. Active states are numbered 0, 1, ... in
 * that order ("A" indices), uninitialised states get their own sequence ("U"), eliminated
 * states are numbered at elimination, newest highest ("E").
 *
 * Solving (one Levenberg-Marquardt iteration): linearise every active observation, build
 * the information (threaded through the host's table), damp it, factor it by recursive
 * block Cholesky elimination with fill-in, back-substitute for the increments, apply them
 * and accept or reject the step on the total cost. States and observations may be
 * eliminated for good: their information becomes a fixed prior (A, b, M) linearised where
 * they were eliminated, which follows the active states along later accepted steps.
 *
 * "ms" arguments are optional memory stacks: when given, records and their arrays come from
 * the stack and are not freed one by one (the stack must outlive the model).
 * "host" arguments are the host's thread table, or null to run on the calling thread.
 * Index values 0xFFFFFFFF mean "unset" or, as a first index of a range, "the whole model". */
#ifndef PLANO_SUMO_H
#define PLANO_SUMO_H

#include "pellux/list.h"
#include "pellux/matrix.h"
#include "pellux/memory.h"
#include "plano/plano_base.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

#define SUMO_UNSET_INDEX 0xFFFFFFFFu
#define SUMO_UNSET_LABEL 2147483647
#define SUMO_NOT_IN_THREAD 0xFFFFFFFFu
/* Type code of a clone state (bSumoStateVectorInitClone). */
#define SUMO_TYPE_CLONE 62
/* Cost of an observation whose evaluation failed. */
#define SUMO_FAILED_RESIDUAL 1.7976931348623157e308

/* Observation kinds. */
#define SUMO_OBS_H 0u
#define SUMO_OBS_H_ROBUST 1u
#define SUMO_OBS_F 2u
#define SUMO_OBS_F_ROBUST 3u

/* State status. */
#define SUMO_STATE_UNINITIALISED 0u
#define SUMO_STATE_ACTIVE 1u
#define SUMO_STATE_ELIMINATED 2u

/* Branch kinds. */
#define SUMO_BRANCH_FROM_BRANCH 0u
#define SUMO_BRANCH_FROM_STATE 1u
#define SUMO_BRANCH_ROOT 2u

/* Information block adjustment of state elimination. */
#define SUMO_ADJUST_NONE 0u
#define SUMO_ADJUST_NO_FILL_IN 1u
#define SUMO_ADJUST_FULL 2u

/* Damping modes. */
#define SUMO_DAMP_MULTIPLICATIVE 0u
#define SUMO_DAMP_ADDITIVE 1u

typedef struct Sumo Sumo;
typedef struct SumoStateVector SumoStateVector;
typedef struct SumoObs SumoObs;
typedef struct SumoBranch SumoBranch;
typedef struct SumoOffdiag SumoOffdiag;
typedef struct SumoWorkspace SumoWorkspace;
typedef struct SumoVector SumoVector;

/* Caller data attached to vectors and to the optimiser: free releases it; copy makes a copy
 * (null reports failure). */
typedef void (*SumoUserFree)(void *data);
typedef void *(*SumoUserCopy)(void *data);

/* h function: writes the prediction h(x) (sized as z) into h when h is not null, and each
 * wanted Jacobian dh/dx_i (dim z x dim x_i) into jacobians[i] when jacobians is not null and
 * the entry is not null. */
typedef Plx_Bool (*SumoHFunction)(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                  uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                  Plx_Matrix **jacobians);
/* F function: as h, writing F(x, z) (expected value 0) and, when Fz is not null, dF/dz.
 * F has z's dimension unless the function resizes F (its Jacobians and Fz then follow). */
typedef Plx_Bool (*SumoFFunction)(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                  uint32_t n_states, const SumoVector *z, Plx_Vector *F,
                                  Plx_Matrix **jacobians, Plx_Matrix *Fz);
/* Called by the solver after an increment or relaxation update (mode 0) and after the old
 * parameters are reinstated (mode 1). */
typedef Plx_Bool (*SumoAdjustFunction)(Sumo *sumo, uint32_t mode, SumoStateVector *state);
/* Selects observations for bSumoObsEliminateSelected: nonzero to eliminate. */
typedef uint32_t (*SumoObsPredicate)(const SumoObs *obs, void *context);

typedef union SumoObsFunction {
    SumoHFunction h;
    SumoFFunction F;
} SumoObsFunction;

/* I/O registrations kept in the Sumo's state_io and obs_io lists (entries allocated with
 * malloc, freed with the Sumo). The read and write functions get the file (a FILE *), the
 * binary flag, the record and the indentation depth. */
typedef Plx_Bool (*SumoStateIOFunction)(void *file, uint32_t binary, SumoStateVector *state, uint32_t depth);
typedef Plx_Bool (*SumoObsIOFunction)(void *file, uint32_t binary, SumoObs *obs, uint32_t depth);
typedef struct SumoStateIORegistration {
    uint32_t tag;                  /* 16-bit tag */
    SumoStateIOFunction read, write;
} SumoStateIORegistration;
typedef struct SumoObsIORegistration {
    uint32_t tag;                  /* 16-bit tag */
    uint32_t kind;                 /* 0 h-type, 1 F-type */
    SumoObsFunction func;
    SumoObsIOFunction read, write;
} SumoObsIORegistration;

/* The value part shared by state vectors and observation vectors. */
struct SumoVector {
    Plx_Vector v;
    int32_t type;            /* caller's type code; 2147483647 when unset */
    int32_t label;           /* caller's label; 2147483647 when unset */
    void *user_data;
    SumoUserFree user_free;  /* null: the data is not owned */
    SumoUserCopy user_copy;
    uint32_t owned;          /* 1: the record came from pSumoVectorForm's heap allocation */
};

/* Per-thread accumulators of a state's information. */
typedef struct SumoThreadBlock {
    Plx_SquMatrix A;
    Plx_Vector b;
} SumoThreadBlock;

struct SumoStateVector {
    SumoVector x;                 /* current parameters; dimension n = x.v.rows */
    Plx_Vector x_old;             /* parameters before a step; during relaxation the adjustment */
    Plx_SquMatrix A;              /* fixed information (the prior), zero at initialisation */
    Plx_SquMatrix A_work;         /* per iteration: A + observations, damped, then its factor */
    SumoOffdiag *row_blocks;      /* blocks with this state as row, by column index */
    SumoOffdiag *col_blocks;      /* blocks with this state as column, by row index */
    uint32_t index;               /* elimination order; 0xFFFFFFFF until numbered */
    Plx_Vector b;                 /* fixed information vector */
    Plx_Vector b_work;            /* per iteration: b + observations, then the increment */
    Plx_SquMatrix covariance;
    uint32_t covariance_valid;
    SumoObs *obs_active;          /* head of the active observations of this state */
    SumoObs *obs_eliminated;      /* head of its eliminated observations */
    uint32_t status;              /* 0 uninitialised, 1 active, 2 eliminated */
    Plx_List elim_blocks;         /* blocks left by states eliminated before this one */
    SumoStateVector *user_state;  /* caller's link to another state */
    Plx_List *user_list;          /* freed with the state, entries with free() */
    SumoAdjustFunction adjust_func;
    double jacobian_step;         /* step of numeric Jacobians, 1e-7 at creation */
    SumoThreadBlock *thread_blocks; /* one per thread of the Sumo */
    SumoStateVector *prev, *next; /* neighbours in the branch (or the eliminated list) */
    SumoBranch *branch;           /* owning branch; null once eliminated or free-standing */
    SumoBranch *sub_branch;       /* branch hanging from this state */
    uint32_t io_tag;              /* 16-bit I/O tag, 0 at creation */
    uint32_t owned;               /* 1: heap record; 0: from a memory stack */
};

struct SumoObs {
    uint32_t kind;                /* SUMO_OBS_... */
    SumoStateVector **states;     /* in the caller's order; null entries are skipped */
    SumoObs **prev_in_state;      /* per slot: neighbours in that state's list */
    SumoObs **next_in_state;
    uint32_t n_states;
    SumoVector z;                 /* type and label are the observation's */
    SumoObsFunction func;
    Plx_SquMatrix N;              /* h-types: inverse covariance of z; F-types: covariance */
    double variance_scaling;      /* robust kinds: s */
    double chi2_cutoff;           /* robust kinds: c */
    double chi2_offset;           /* robust kinds: (1 - 1/s) c */
    double weight;                /* multiplies information and cost, 1.0 at creation */
    uint32_t numeric_jacobians;   /* 1: central differences */
    uint32_t outlier;             /* robust kinds: current decision */
    uint32_t eliminated;
    uint32_t store_states;        /* 1: keep copies of the states at elimination */
    Plx_Vector *stored_states;    /* one per state, or null */
    SumoObs *prev, *next;         /* neighbours in the Sumo's active or eliminated list */
    uint32_t io_tag;              /* 16-bit I/O tag */
    uint32_t owned;               /* 1: heap record */
};

struct SumoBranch {
    SumoStateVector *first, *last; /* active (and uninitialised) states */
    SumoStateVector *eliminated;   /* states of this branch kept after elimination */
    uint32_t first_index;          /* next index when the branch's own states begin */
    uint32_t last_index;           /* index of its last active state; 0xFFFFFFFF when none */
    SumoBranch *sub;               /* next branch in the chain hanging from this one */
    uint32_t kind;                 /* SUMO_BRANCH_... */
    void *parent;                  /* parent branch (kind 0) or state (kind 1); null for root */
};

struct SumoOffdiag {
    Plx_Matrix M;                  /* fixed block (dim row x dim col) */
    Plx_Matrix M_work;             /* per iteration; after elimination L^-1 times it */
    Plx_Matrix M_cov;              /* covariance between the two states */
    Plx_Matrix *thread_blocks;     /* one per thread of the Sumo */
    SumoStateVector *row, *col;    /* row earlier than col in elimination order */
    SumoOffdiag *row_prev, *row_next;
    SumoOffdiag *col_prev, *col_next;
};

/* Scratch space for evaluating one observation; one per thread. Arrays grow, never shrink. */
struct SumoWorkspace {
    Plx_Vector residual;
    uint32_t capacity;             /* entries of the three arrays */
    Plx_Matrix *jacobians;         /* per observation state */
    Plx_Matrix *nj;                /* N' times each Jacobian */
    Plx_Matrix **jacobian_ptrs;    /* the Jacobians asked of the function, null when unwanted */
    Plx_Matrix Fz;                 /* dF/dz */
    Plx_Vector h;                  /* h(x) or F */
    Plx_SquMatrix N_eff;           /* the observation's effective information */
    Plx_Matrix mat;                /* general scratch (block transposes, Fz N) */
    Plx_SquMatrix squ;             /* general scratch */
    Plx_Vector vec;                /* general scratch (numeric differences) */
    uint32_t owned;
};

struct Sumo {
    SumoBranch *root;
    SumoStateVector *elim_last, *elim_first; /* eliminated states, newest first */
    double residual;               /* cached cost of the last solved range */
    uint32_t modified;             /* observations changed since the cost was cached */
    SumoStateVector *cache_first, *cache_last;
    SumoBranch *cache_branch;
    SumoObs *obs_active;           /* newest first */
    SumoObs *obs_eliminated;
    uint32_t indices_valid;
    Plx_List *state_io;            /* state I/O registrations */
    Plx_List *obs_io;              /* observation I/O registrations */
    uint32_t covariance_done;
    uint32_t n_threads;            /* T: the host's thread count at forming, 0 without a host */
    void *user_data;
    SumoUserFree user_free;
    SumoUserCopy user_copy;
    uint32_t owned;
    Plx_Bool (*io_header_read)(void *file, uint32_t binary, void *arg);
    Plx_Bool (*io_header_write)(void *file, uint32_t binary, void *arg);
    void *io_header_arg;
    /* Private: per-job workspaces kept between builds, the last whole-model build, and the
     * fused observation terms of a threaded build computed ahead of their accumulation. */
    SumoWorkspace *job_workspaces;
    uint32_t n_job_workspaces;
    void *build_cache;
    void *fused_ahead;
};

/* ---- optimiser ---- */

/* Forms (sumo null: allocates) an empty optimiser with a root branch; T from the host's
 * thread count (0 without a host: threaded operations then run as one job). */
PLANO_API Sumo *pSumoForm(Sumo *sumo, const ThreadHostInterface *host);
/* Frees everything the optimiser owns, then the record when owned. */
PLANO_API void vSumoFree(Sumo *sumo, const ThreadHostInterface *host);
PLANO_API SumoWorkspace *pSumoWorkspaceForm(SumoWorkspace *workspace);
PLANO_API void vSumoWorkspaceFree(SumoWorkspace *workspace);
/* Deep copy: branch tree and states (same order, with their fixed information and the fixed
 * blocks between them), active observations rebuilt on the copies, I/O registrations,
 * header functions and user data (through user_copy). dest null: allocated. */
PLANO_API Sumo *pSumoCopy(const Sumo *source, Sumo *dest, Plx_MemoryStack *ms,
                          const ThreadHostInterface *host);
/* Renumbers every state in elimination order (A and U indices). */
PLANO_API Plx_Bool bSumoSetStateIndices(Sumo *sumo);
/* Lowest and highest active index inside the branch (hanging and sub-branches included);
 * 0xFFFFFFFF when none. */
PLANO_API Plx_Bool bSumoGetIndexLimitsBranch(const SumoBranch *branch, uint32_t *first, uint32_t *last);
PLANO_API Plx_Bool bSumoGetIndexLimitsState(const SumoStateVector *state, uint32_t *first, uint32_t *last);
/* The same over a run of states of one branch; code 7 when last cannot be reached. */
PLANO_API Plx_Bool bSumoGetIndexLimitsStateRange(const SumoStateVector *first_state,
                                                 const SumoStateVector *last_state, uint32_t *first,
                                                 uint32_t *last);

/* ---- state vectors ---- */

/* A new uninitialised state of dimension n appended to the branch (free-standing when the
 * branch is null). */
PLANO_API SumoStateVector *pSumoStateVectorNew(Sumo *sumo, SumoBranch *branch, uint32_t n,
                                               Plx_MemoryStack *ms, const ThreadHostInterface *host);
PLANO_API SumoStateVector *pSumoStateVectorNewBefore(Sumo *sumo, SumoBranch *branch, uint32_t n,
                                                     Plx_MemoryStack *ms, SumoStateVector *existing,
                                                     const ThreadHostInterface *host);
PLANO_API SumoStateVector *pSumoStateVectorNewAfter(Sumo *sumo, SumoBranch *branch, uint32_t n,
                                                    Plx_MemoryStack *ms, SumoStateVector *existing,
                                                    const ThreadHostInterface *host);
/* Initialises (re-initialises) the state: x from x0 when given, A and b zero, status active. */
PLANO_API Plx_Bool bSumoStateVectorInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector *x0);
/* Back to uninitialised: user data freed, blocks freed, covariance and adjust function
 * cleared. Code 7 for an eliminated state. */
PLANO_API Plx_Bool bSumoStateVectorUninit(Sumo *sumo, SumoStateVector *state,
                                          const ThreadHostInterface *host);
/* Turns the state into a clone of source (type 62): observations deleted, x zeroed,
 * initialised, user data pointing at the state cloned. */
PLANO_API Plx_Bool bSumoStateVectorInitClone(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                             SumoStateVector *source, const ThreadHostInterface *host);
/* Moves the state to the end of the target branch, re-orienting its blocks. */
PLANO_API Plx_Bool bSumoStateVectorMoveBranch(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                              SumoBranch *target);
/* A copy of the state (x, A, b, status, I/O tag, Jacobian step, hanging branch) in branch. */
PLANO_API SumoStateVector *pSumoStateVectorCopy(const SumoStateVector *source, Sumo *sumo, SumoBranch *branch,
                                                Plx_MemoryStack *ms, const ThreadHostInterface *host);
PLANO_API void vSumoStateVectorSetAdjustFunc(SumoStateVector *state, SumoAdjustFunction func);
/* Number of active observations of the state. */
PLANO_API uint32_t uiSumoStateVectorObsListSize(const SumoStateVector *state);
/* Frees the state and what it owns (unlinking nothing: for whole-model teardown). */
PLANO_API void vSumoStateVectorFree(Sumo *sumo, SumoStateVector *state, const ThreadHostInterface *host);
PLANO_API void vSumoStateVectorListFree(Sumo *sumo, SumoStateVector *first, const ThreadHostInterface *host);
/* Removes a state with no active observation, no hanging branch and (dimension 0 or status
 * uninitialised); otherwise code 7. */
PLANO_API Plx_Bool bSumoStateDelete(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                    const ThreadHostInterface *host);
PLANO_API SumoVector *psvSumoGetState(SumoStateVector *state);
PLANO_API Plx_SquMatrix *pgsmSumoGetCovmatDiag(SumoStateVector *state);
PLANO_API Plx_SquMatrix *pgsmSumoGetInfmatDiag(SumoStateVector *state);

/* ---- vectors ---- */

PLANO_API SumoVector *pSumoVectorForm(SumoVector *vector, uint32_t size, Plx_MemoryStack *ms);
/* Numbers, type, label and user data (shared without user_free, else copied; code 7 when
 * user_copy is missing, code 1 when it fails). Sizes must match (code 7). */
PLANO_API Plx_Bool bSumoVectorCopy(const SumoVector *source, SumoVector *dest);
PLANO_API SumoVector *pSumoVectorCopy(const SumoVector *source, SumoVector *dest, Plx_MemoryStack *ms);
PLANO_API void vSumoVectorFree(SumoVector *vector);

/* ---- observations ---- */

/* h-type observation z ~ h(x) with inverse covariance Ni on n_states states. */
PLANO_API SumoObs *pSumoObsH(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                             Plx_MemoryStack *ms, SumoStateVector **states, uint32_t n_states);
/* Robust h-type: above chi-squared c the variance is scaled by s. */
PLANO_API SumoObs *pSumoObsHRobust(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                                   double s, double c, Plx_MemoryStack *ms, SumoStateVector **states,
                                   uint32_t n_states);
/* F-type observation F(x, z) ~ 0 with N the covariance of z. */
PLANO_API SumoObs *pSumoObsF(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                             Plx_MemoryStack *ms, SumoStateVector **states, uint32_t n_states);
PLANO_API SumoObs *pSumoObsFRobust(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                                   double s, double c, Plx_MemoryStack *ms, SumoStateVector **states,
                                   uint32_t n_states);
/* The same with the states as arguments after ms, ended by a null. */
PLANO_API SumoObs *pSumoObsH_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                                Plx_MemoryStack *ms, ...);
PLANO_API SumoObs *pSumoObsHRobust_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni,
                                      SumoHFunction h, double s, double c, Plx_MemoryStack *ms, ...);
PLANO_API SumoObs *pSumoObsF_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                                Plx_MemoryStack *ms, ...);
PLANO_API SumoObs *pSumoObsFRobust_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N,
                                      SumoFFunction F, double s, double c, Plx_MemoryStack *ms, ...);
/* Replaces z and/or the matrix (null keeps it), resets the weight to 1. */
PLANO_API Plx_Bool bSumoObsH_Overwrite(Sumo *sumo, SumoObs *obs, const Plx_Vector *z, const Plx_SquMatrix *Ni);
PLANO_API Plx_Bool bSumoObsF_Overwrite(Sumo *sumo, SumoObs *obs, const Plx_Vector *z, const Plx_SquMatrix *N);
/* Makes an h- or F-type observation robust and sets its decision; code 12 for other kinds. */
PLANO_API Plx_Bool bSumoObs_Robustify(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, double s, double c);
PLANO_API Plx_Bool bSumoObs_DeRobustify(Sumo *sumo, SumoObs *obs);
/* Next / previous observation in the state's list; null (code 7) when the state is not one
 * of the observation's. */
PLANO_API SumoObs *pSumoObsGetNext(const SumoObs *obs, const SumoStateVector *state);
PLANO_API SumoObs *pSumoObsGetPrev(const SumoObs *obs, const SumoStateVector *state);
PLANO_API Plx_Bool bSumoObsSwapStates(SumoObs *obs, uint32_t i, uint32_t j);
/* Removes an observation (its information is first taken out of the prior when it was
 * eliminated) and frees it. */
PLANO_API Plx_Bool bSumoObsDelete(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs,
                                  const ThreadHostInterface *host);
/* Folds the observation's information into the fixed prior and moves it to the eliminated
 * lists. */
PLANO_API Plx_Bool bSumoObsEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs,
                                     const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoObsEliminateSelected(Sumo *sumo, SumoWorkspace *workspace, SumoObsPredicate predicate,
                                             void *context, const ThreadHostInterface *host);
/* Takes an eliminated observation's information out of the prior and makes it active. */
PLANO_API Plx_Bool bSumoObsRestore(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs,
                                   const ThreadHostInterface *host);
/* Frees an unlinked observation / a list of them through next. */
PLANO_API void vSumoObsFree(SumoObs *obs);
PLANO_API void vSumoObsListFree(SumoObs *first);

/* ---- branches ---- */

PLANO_API SumoBranch *pSumoBranchRoot(void);
/* A new empty branch between branch and its current sub-branch. */
PLANO_API SumoBranch *pSumoBranchNewFromBranch(Sumo *sumo, SumoBranch *branch);
/* A new empty branch hanging from the state (which must have none: code 7). */
PLANO_API SumoBranch *pSumoBranchNewFromState(Sumo *sumo, SumoStateVector *state);
PLANO_API Plx_Bool bSumoBranchCopy(Sumo *sumo, SumoBranch *dest, const SumoBranch *source,
                                   Plx_MemoryStack *ms, const ThreadHostInterface *host);
/* Eliminates the sub chain, then every state in order, then releases the branch. */
PLANO_API Plx_Bool bSumoBranchEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoBranch *branch,
                                        uint32_t adjust_type, const ThreadHostInterface *host);
/* Removes a branch with no states (else code 7), its sub-branch taking its place. */
PLANO_API Plx_Bool bSumoBranchDelete(Sumo *sumo, SumoBranch *branch);
PLANO_API void vSumoBranchFree(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host);

/* ---- off-diagonal blocks ---- */

PLANO_API SumoOffdiag *pSumoOffdiagNew(Sumo *sumo, SumoStateVector *row, SumoStateVector *col,
                                       SumoOffdiag *row_prev, SumoOffdiag *row_next, SumoOffdiag *col_prev,
                                       SumoOffdiag *col_next);
/* Finds the block (row, col) (existing: link this block instead of making one when create
 * is 1); *out is the block or null. */
PLANO_API Plx_Bool bSumoOffdiagSearchGen(Sumo *sumo, SumoStateVector *row, SumoStateVector *col, uint32_t create,
                                         SumoOffdiag *existing, SumoOffdiag *hint, SumoOffdiag **out);
/* Unlinks every block of a row (column) list from its column (row) list. */
PLANO_API void vSumoOffdiagCutoffRow(SumoOffdiag *first);
PLANO_API void vSumoOffdiagCutoffCol(SumoOffdiag *first);
/* Frees every block of a row (column) list, through row_next (col_next). */
PLANO_API void vSumoOffdiagFreeRow(Sumo *sumo, SumoOffdiag *first);
PLANO_API void vSumoOffdiagFreeCol(Sumo *sumo, SumoOffdiag *first);
PLANO_API Plx_Bool bSumoCreateOffdiagBlocksBranch(Sumo *sumo, SumoBranch *branch, uint32_t *first,
                                                  uint32_t *last);
PLANO_API Plx_Bool bSumoCreateOffdiagBlocksStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t *first,
                                                      uint32_t *last);

/* ---- solver ---- */

/* Evaluates one observation and adds (add 1) or subtracts its information: into the fixed
 * A/b/M (eliminate 1), a thread's accumulators (thread index not 0xFFFFFFFF) or the work
 * copies. Jacobians are taken for states with index in [first, last] (first 0xFFFFFFFF: all). */
PLANO_API Plx_Bool bSumoObsEvaluate(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, uint32_t residual,
                                    uint32_t eliminate, uint32_t add, uint32_t first, uint32_t last,
                                    uint32_t thread);
PLANO_API Plx_Bool bSumoBuildInformationBlocksBranch(Sumo *sumo, SumoBranch *branch, uint32_t residual,
                                                     uint32_t first, uint32_t last,
                                                     const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoBuildInformationBlocksStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                         SumoStateVector *last_state, uint32_t first,
                                                         uint32_t last, const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoEvaluateObsBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last,
                                          const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoEvaluateObsStateRange(Sumo *sumo, SumoStateVector *first_state,
                                              SumoStateVector *last_state, uint32_t first, uint32_t last,
                                              const ThreadHostInterface *host);
/* Work copies = fixed copies, thread accumulators zero, for states up to last. */
PLANO_API Plx_Bool bSumoResetInfoBranch(Sumo *sumo, SumoBranch *branch, uint32_t last);
PLANO_API Plx_Bool bSumoResetInfoStateRange(Sumo *sumo, SumoStateVector *first_state,
                                            SumoStateVector *last_state, uint32_t last);
/* Adds the thread accumulators into the work copies (into_fixed 0) or the fixed ones. */
PLANO_API Plx_Bool bSumoCombineThreadedInfoBranch(Sumo *sumo, SumoBranch *branch, uint32_t last,
                                                  uint32_t into_fixed);
PLANO_API Plx_Bool bSumoCombineThreadedInfoStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t last,
                                                      uint32_t into_fixed);
/* Damps the diagonal of every active A_work: a (1 + lambda) in mode 0, a + lambda otherwise. */
PLANO_API Plx_Bool bDampInformationMatrixState(SumoStateVector *state, double lambda, uint32_t mode);
PLANO_API Plx_Bool bDampInformationMatrixBranch(SumoBranch *branch, double lambda, uint32_t mode);
PLANO_API Plx_Bool bDampInformationMatrixStateRange(SumoStateVector *first_state, SumoStateVector *last_state,
                                                    double lambda, uint32_t mode);
/* Block Cholesky elimination up to the last index. A block that is not positive definite
 * fails: with error_code given, the code is left there and nothing is registered. */
PLANO_API Plx_Bool bRecursiveEliminationBranch(Sumo *sumo, SumoBranch *branch, uint32_t solve, double lambda,
                                               uint32_t mode, uint32_t last, int32_t *error_code);
PLANO_API Plx_Bool bRecursiveEliminationStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                   SumoStateVector *last_state, uint32_t solve, double lambda,
                                                   uint32_t mode, uint32_t last, int32_t *error_code);
/* Back substitution (apply 1: increments into b_work), or covariances (apply 0), stopping
 * after the covariance target when one is given. */
PLANO_API Plx_Bool bBackSubstitutionBranch(Sumo *sumo, SumoBranch *branch, SumoStateVector *target,
                                           uint32_t apply, uint32_t first, uint32_t last);
PLANO_API Plx_Bool bBackSubstitutionStateRange(Sumo *sumo, SumoStateVector *first_state,
                                               SumoStateVector *last_state, SumoStateVector *target,
                                               uint32_t apply, uint32_t first, uint32_t last);
/* x += increment, then adjust_func mode 0. */
PLANO_API Plx_Bool bIncrementParametersBranch(Sumo *sumo, SumoBranch *branch);
PLANO_API Plx_Bool bIncrementParametersStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                  SumoStateVector *last_state);
/* x_old = x for every active state. */
PLANO_API Plx_Bool bSumoStoreParametersBranch(SumoBranch *branch, const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoStoreParametersStateRange(SumoStateVector *first_state, SumoStateVector *last_state,
                                                  const ThreadHostInterface *host);
/* x = x_old, then adjust_func mode 1. */
PLANO_API Plx_Bool bSumoReinstateOldParametersBranch(Sumo *sumo, SumoBranch *branch);
PLANO_API Plx_Bool bSumoReinstateOldParametersStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                         SumoStateVector *last_state);
PLANO_API Plx_Bool bSumoReinstateOldParametersState(Sumo *sumo, SumoStateVector *state);
/* Moves the fixed information vectors to the new linearisation point after a step. */
PLANO_API Plx_Bool bAdjustInformationVectorBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last);
PLANO_API Plx_Bool bAdjustInformationVectorStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t first,
                                                      uint32_t last);
/* Cost of one observation; 1.7976931348623157e308 when it cannot be evaluated. */
PLANO_API double dSumoObsComputeResidual(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs);
/* Total cost of the active observations (and the eliminated ones when include_eliminated). */
PLANO_API double dSumoComputeResidual(Sumo *sumo, uint32_t include_eliminated, const ThreadHostInterface *host);
PLANO_API double dSumoComputeResidualBranch(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host);
PLANO_API double dSumoComputeResidualStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                SumoStateVector *last_state, const ThreadHostInterface *host);
PLANO_API double dSumoComputeResidualState(Sumo *sumo, SumoStateVector *state, const ThreadHostInterface *host);
/* One Levenberg-Marquardt iteration on a branch (accepted null: Gauss-Newton, the step is
 * always taken); apply 0 computes covariances instead of stepping. */
PLANO_API Plx_Bool bSumoLevMarqIterationBranchGen(Sumo *sumo, SumoBranch *branch, SumoStateVector *target,
                                                  uint32_t apply, double lambda, uint32_t mode, uint32_t first,
                                                  uint32_t last, uint32_t *accepted, double *reduction,
                                                  const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoLevMarqIterationStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                   SumoStateVector *last_state, double lambda, uint32_t mode,
                                                   uint32_t first, uint32_t last, uint32_t *accepted,
                                                   double *reduction, const ThreadHostInterface *host);
/* Marginalises the state (its hanging branch and observations first) into its neighbours'
 * prior; adjust_type 0 none, 1 without fill-in, 2 full. */
PLANO_API Plx_Bool bSumoStateEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                       uint32_t adjust_type, const ThreadHostInterface *host);
/* Reverses an elimination, appending the state to target (code 7 when it is not eliminated
 * or a neighbour of it has been eliminated since). */
PLANO_API Plx_Bool bSumoStateRestore(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                     SumoBranch *target, uint32_t adjust_type, const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoRelaxationInitBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last,
                                             const ThreadHostInterface *host);
PLANO_API Plx_Bool bSumoGaussSeidelIterationBranch(Sumo *sumo);
PLANO_API Plx_Bool bSumoSORIterationBranch(Sumo *sumo, SumoBranch *branch, double omega);
/* Sum of squared norms of the linear-system residuals of the active states. */
PLANO_API double dSumoRelaxationResidualBranch(Sumo *sumo, SumoBranch *branch);
PLANO_API Plx_Bool bSumoRelaxationFinishBranch(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host);

#ifdef __cplusplus
}
#endif

#endif
