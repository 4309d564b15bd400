#pragma once

#include <string>

#include "tools/receiving/arrival.h"

// Arrivals in one line each, without time and colour, fit for a terminal. Threads: any.

namespace tarnel::lab {

// "OW  Meetwell / video-call  51 events (method 2 x32, 1 x19)  3.4 kB gzip of 31.2 kB"
std::string summaryOf(const Arrival& arrival);
// "file \"a b.log.gz\"  session 77  1.2 kB gzip of 4.0 kB  in 20261120-142501-0001-a_b.log"
std::string summaryOf(const UploadArrival& arrival);
// "log data  2 records  340 B  in 20261120-142501-0002-records.archive"
std::string summaryOf(const LogDataArrival& arrival);
// "client type 12  session 7  event 3  method 1  status 8  a=1 b=two", then "again (3)" for a repetition.
std::string summaryOf(const DatagramArrival& arrival);

}  // namespace tarnel::lab
