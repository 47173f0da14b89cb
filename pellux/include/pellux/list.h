/* Placeholder: declarations arrive with their implementation. */
#ifndef PELLUX_LIST_H
#define PELLUX_LIST_H
#include "pellux/base.h"
#endif
