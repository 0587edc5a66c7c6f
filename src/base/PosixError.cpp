#include "base/PosixError.h"

#include <cstring>

namespace bexil {

std::string posixMessage(int error, std::string_view what) {
    std::string message(what);
    message += ": ";
    message += std::strerror(error);
    return message;
}

Error posixError(int error, std::string_view what) {
    return Error(std::string(BXPosixErrorDomain), error, posixMessage(error, what));
}

}  // namespace bexil
