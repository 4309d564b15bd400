#pragma once

struct sd_bus_message;

namespace tarnel {

// Answers what general D-Bus tools ask a peer before they call it: a Hello as if there were a bus, and
// introspection. True when the call was one of those. On the connection's thread.
bool answerGenericTool(sd_bus_message* call);

}  // namespace tarnel
