/* Export macro and basic types of the engine's C interface. */
#ifndef PLANO_PLANO_BASE_H
#define PLANO_PLANO_BASE_H

#include "pellux/base.h"
#include "pellux/error.h"

#if defined(PLANO_BUILDING_LIBRARY)
#define PLANO_API __attribute__((visibility("default")))
#else
#define PLANO_API
#endif

#endif
