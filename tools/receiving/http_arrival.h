#pragma once

#include "tools/receiving/arrival.h"

namespace tarnel::lab {

// What strangers sent with a request, made fit for printing.
void describeRequest(const HttpRequest& request, double now, HttpArrival& arrival);

}  // namespace tarnel::lab
