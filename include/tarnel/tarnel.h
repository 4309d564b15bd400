#ifndef TARNEL_TARNEL_H_
#define TARNEL_TARNEL_H_

// The C++ interface of libtarnel, the client library of tarneld.

#include "tarnel/keys.h"
#include "tarnel/session.h"
#include "tarnel/value.h"

#endif
