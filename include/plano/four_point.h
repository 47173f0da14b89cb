/* Placeholder: declarations arrive with their implementation. */
#ifndef PLANO_FOUR_POINT_H
#define PLANO_FOUR_POINT_H
#include "plano/plano_base.h"
#endif
