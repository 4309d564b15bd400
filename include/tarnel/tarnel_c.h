#ifndef TARNEL_TARNEL_C_H_
#define TARNEL_TARNEL_C_H_

/* The C interface of libtarnel, the client library of tarneld. */

#include "tarnel/tarnel_c_keys.h"
#include "tarnel/tarnel_c_session.h"
#include "tarnel/tarnel_c_types.h"
#include "tarnel/tarnel_c_value.h"

#endif
