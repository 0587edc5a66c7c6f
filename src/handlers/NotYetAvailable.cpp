// Request names whose operations this daemon does not have yet. Each answers code 4 with a message that says so,
// rather than "unrecognized request", so a client can tell a missing feature from a typo.

#include "daemon/Transaction.h"

namespace bexil {

void Transaction::readyPlugIns() { fail(ErrorCode::OperationFailed, "the \"ready\" operation is not available yet"); }
void Transaction::accessPlugIns() { fail(ErrorCode::OperationFailed, "the \"access\" operation is not available yet"); }

}  // namespace bexil
