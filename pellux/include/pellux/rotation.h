/* Placeholder: declarations arrive with their implementation. */
#ifndef PELLUX_ROTATION_H
#define PELLUX_ROTATION_H
#include "pellux/base.h"
#endif
