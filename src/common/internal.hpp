// Helpers shared by the engine's source files.
#ifndef PLANO_SRC_COMMON_INTERNAL_HPP
#define PLANO_SRC_COMMON_INTERNAL_HPP

#include "pellux/detail/util.hpp"
#include "plano/plano_base.h"

#endif
