/* Placeholder until the reference host lands. */
#ifndef PLANO_HOST_HOST_H
#define PLANO_HOST_HOST_H
#include "plano/plano.h"
#endif
