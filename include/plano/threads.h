/* Placeholder: declarations arrive with their implementation. */
#ifndef PLANO_THREADS_H
#define PLANO_THREADS_H
#include "plano/plano_base.h"
#endif
