/* Placeholder: declarations arrive with their implementation. */
#ifndef PELLUX_FILEIO_H
#define PELLUX_FILEIO_H
#include "pellux/base.h"
#endif
