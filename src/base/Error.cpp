#include "base/Error.h"

namespace bexil {

std::string Error::description() const {
    std::string out = "Error Domain=" + domain_ + " Code=" + std::to_string(code_);
    if (message_) out += " \"" + *message_ + "\"";
    return out;
}

Error BXError(int code, std::optional<std::string_view> message) {
    if (!message) return Error(std::string(BXErrorDomain), code);
    return Error(std::string(BXErrorDomain), code, std::string(*message));
}

std::string exceptionMessage(const std::exception_ptr& exception) {
    try {
        std::rethrow_exception(exception);
    } catch (const std::exception& e) {
        return e.what();
    } catch (...) {
    }
    return "unknown exception";
}

}  // namespace bexil
