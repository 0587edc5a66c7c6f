// The request whose operation this daemon does not have yet. It answers code 4 with a message that says so, rather
// than "unrecognized request", so a client can tell a missing feature from a typo.

#include "daemon/Transaction.h"

namespace bexil {

void Transaction::readyPlugIns() { fail(ErrorCode::OperationFailed, "the \"ready\" operation is not available yet"); }

}  // namespace bexil
