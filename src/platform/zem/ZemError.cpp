#include "platform/zem/ZemError.h"

namespace bexil {

std::string ZemError::description() const {
    switch (kind_) {
        case Kind::ConnectionInvalid:
            return "Connection invalid";
        case Kind::ConnectionInterrupted:
            return "Connection interrupted";
        case Kind::TerminationImminent:
            return "Termination imminent";
        case Kind::MessageInvalid:
            return "Message invalid";
    }
    return "Unknown connection error";
}

}  // namespace bexil
