#include "platform/ksn/ConsentStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "base/Document.h"
#include "base/StandardPaths.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

constexpr std::string_view kBundleIdentifierKey = "BDBundleIdentifier";

}  // namespace

fs::path ConsentStore::defaultFile() {
    // With no home at all, "/" is a directory that can be read but where nothing will be found.
    return stateDirectory().value_or("/") / kFileName;
}

ConsentStore::ConsentStore(fs::path file) : file_(std::move(file)) {}

Result<Value> ConsentStore::readDocument() const {
    std::error_code ec;
    uintmax_t size = fs::file_size(file_, ec);
    if (ec == std::errc::no_such_file_or_directory) return Value::emptyDictionary();
    if (!ec && size > kMaxConsentFileBytes) {
        log::ops().error("consent file %{public}@ is larger than %zu bytes", file_.string(), kMaxConsentFileBytes);
        return BXError(ErrorCode::OperationFailed, file_.string() + " is larger than the consent size limit");
    }
    Result<Value> document = Document::readFile(file_);
    if (!document) {
        // Gone between the two looks: the same as never there.
        if (document.error().domain() == BXPosixErrorDomain && document.error().code() == ENOENT)
            return Value::emptyDictionary();
        return document.error();
    }
    if (!document->isDictionary())
        return BXError(ErrorCode::OperationFailed, file_.string() + " does not hold a dictionary");
    return document;
}

std::optional<std::vector<ConsentRecord>> ConsentStore::informationForBundleIdentifier(
    std::string_view bundleIdentifier) const {
    Result<Value> document = readDocument();
    if (!document) {
        log::ops().error("consent store %{public}@ cannot be read: %{public}@", file_.string(), document.error());
        return std::nullopt;
    }
    const Value* services = document->find(bundleIdentifier);
    if (services == nullptr) return std::vector<ConsentRecord>{};
    if (!services->isDictionary()) {
        log::ops().error("consent store %{public}@: the entry of %{public}s is not a dictionary", file_.string(),
                         std::string(bundleIdentifier));
        return std::nullopt;
    }
    std::vector<ConsentRecord> records;
    for (const auto& entry : services->entries()) records.push_back({entry.key, entry.value.getBool()});
    std::sort(records.begin(), records.end(),
              [](const ConsentRecord& a, const ConsentRecord& b) { return a.service < b.service; });
    return records;
}

std::set<std::string> ConsentStore::grantedServices(std::string_view bundleIdentifier) const {
    std::set<std::string> granted;
    if (auto records = informationForBundleIdentifier(bundleIdentifier))
        for (const ConsentRecord& record : *records)
            if (record.granted == true) granted.insert(record.service);
    return granted;
}

std::optional<std::vector<ConsentRecord>> ConsentStore::copyInformationForBundle(const PlatformBundle& bundle) const {
    std::optional<Value> info = bundle.infoDictionary();
    if (!info || !info->isDictionary()) return std::nullopt;
    const std::string* identifier = info->get(kBundleIdentifierKey).getString();
    if (identifier == nullptr || identifier->empty()) return std::nullopt;
    return informationForBundleIdentifier(*identifier);
}

std::optional<Error> ConsentStore::setGranted(std::string_view bundleIdentifier, std::string_view service,
                                              bool granted) {
    if (bundleIdentifier.empty() || service.empty())
        return BXError(ErrorCode::OperationFailed, "a consent answer needs a bundle identifier and a service name");
    fs::path directory = file_.parent_path().empty() ? fs::path(".") : file_.parent_path();
    std::error_code ec;
    fs::create_directories(directory, ec);
    if (ec) return posixError(ec.value(), "cannot create " + directory.string());

    int lockFd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (lockFd < 0) return posixError(errno, "cannot open " + directory.string());
    std::optional<Error> result;
    while (::flock(lockFd, LOCK_EX) != 0) {
        if (errno != EINTR) {
            result = posixError(errno, "cannot lock " + directory.string());
            break;
        }
    }
    if (!result) {
        Result<Value> document = readDocument();
        if (!document) {
            result = document.error();
        } else {
            const Value* current = document->find(bundleIdentifier);
            if (current != nullptr && !current->isDictionary()) {
                result = BXError(ErrorCode::OperationFailed,
                                 "the consent entry of " + std::string(bundleIdentifier) + " is not a dictionary");
            } else {
                MutableDictionary services(current ? *current : Value::emptyDictionary());
                services.set(service, Value::boolean(granted));
                MutableDictionary updated(*document);
                updated.set(bundleIdentifier, services.take());
                result = Document::writeFileAtomically(file_, updated.take());
            }
        }
    }
    ::close(lockFd);
    return result;
}

}  // namespace bexil
