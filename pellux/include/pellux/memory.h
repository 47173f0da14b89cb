/* Placeholder: declarations arrive with their implementation. */
#ifndef PELLUX_MEMORY_H
#define PELLUX_MEMORY_H
#include "pellux/base.h"
#endif
