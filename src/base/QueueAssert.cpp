#include "base/QueueAssert.h"

#include <string>

#include "base/Error.h"

namespace bexil::detail {

void failQueueAssertion(std::string_view label, QueueExpectation expected, const char* file, int line) {
    std::string message = expected == QueueExpectation::OnQueue ? "not on queue \"" : "unexpectedly on queue \"";
    message.append(label);
    message.append("\" at ");
    message.append(file);
    message.push_back(':');
    message.append(std::to_string(line));
    throw InternalInconsistency(message);
}

}  // namespace bexil::detail
