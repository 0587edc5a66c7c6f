// The registration requests ("add", "remove", "bulk") and the two walkers that other handlers build on: the path
// walker and the UUID-list walker. Every walker stops at the first element that fails and leaves the reply to the
// code that failed; work done for earlier elements is not undone, because the registry's changes are per bundle.
// "add" and "remove" walk their paths on the database's writer queue, where each registry change waits for its
// commit to reach the disk; the reply goes out from the request queue once the walk is done.

#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "base/ActingAs.h"
#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "platform/log/Log.h"
#include "platform/trace/Probes.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

namespace {

// Resolved paths longer than this are treated as not resolving, as with the fixed buffer clients were promised.
constexpr size_t kResolvedPathBufferSize = 1024;
// Entitlement that a caller needs to unregister plug-ins.

// The canonical absolute path of `path`, or none when it does not resolve (or does not fit the buffer size), as
// `resolveAs` sees it when given.
std::optional<std::string> resolvePath(const std::string& path, std::optional<UserIdentity> resolveAs) {
    // A path with an embedded NUL cannot name a file; realpath would silently look at a prefix of it.
    if (path.find('\0') != std::string::npos) return std::nullopt;
    ActingAs resolver(resolveAs);
    if (!resolver.ok()) return std::nullopt;
    std::unique_ptr<char, decltype(&free)> resolved(realpath(path.c_str(), nullptr), &free);
    if (!resolved || strlen(resolved.get()) >= kResolvedPathBufferSize) return std::nullopt;
    return std::string(resolved.get());
}

}  // namespace

bool Transaction::marshalPaths(const RegistrationHandler& handler, std::optional<UserIdentity> resolveAs) {
    std::optional<Value> paths = zem_dictionary_get_array(request(), protocol::key::kPaths);
    if (!paths) {
        fail(ErrorCode::InvalidRequest, "invalid request format");
        return false;
    }
    for (const Value& element : paths->items()) {
        const std::string* path = element.getString();
        if (path == nullptr) {
            fail(ErrorCode::InvalidRequest, "invalid request format");
            return false;
        }
        if (path->empty() || path->front() != '/') {
            fail(ErrorCode::BadPath, formatPrintf("absolute path required: %s", *path));
            return false;
        }
        std::optional<std::string> resolved = resolvePath(*path, resolveAs);
        if (!handler(resolved ? *resolved : *path, resolved.has_value())) return false;
    }
    return true;
}

bool Transaction::processPaths(const RegistrationHandler& handler, std::optional<UserIdentity> resolveAs) {
    if (!marshalPaths(handler, resolveAs)) return false;
    done();
    return true;
}

bool Transaction::processUuidList(const PlugInHandler& handler) {
    std::optional<Value> uuids = zem_dictionary_get_array(request(), protocol::key::kUuids);
    if (!uuids) {
        fail(ErrorCode::InvalidRequest, "invalid request format (uuid)");
        return false;
    }
    for (const Value& element : uuids->items()) {
        const Uuid* bytes = element.getUuid();
        if (bytes == nullptr) {
            fail(ErrorCode::InvalidRequest, "invalid request (bad uuid array)");
            return false;
        }
        // A UUID value is always its 16 bytes, so making the UUID object cannot fail here; the answer for that case
        // ("invalid request (uuid allocation failure)") therefore never goes out.
        Uuid uuid(bytes->bytes());
        std::shared_ptr<BXDPlugIn> plugIn = server()->findPlugIn(uuid);
        if (!plugIn) {
            fail(ErrorCode::InvalidRequest, "no such plugin (uuid not found)");
            return false;
        }
        if (!handler(plugIn)) return false;
    }
    return true;
}

void Transaction::addPlugIns() {
    // A client registers what it can read: every file of the bundle is reached with its rights, not bxd's. A client
    // whose connection is already gone has no known rights, and an identity the kernel cannot take reads nothing.
    const std::optional<UserIdentity> caller =
        client()->user().value_or(UserIdentity{static_cast<uid_t>(-1), static_cast<gid_t>(-1)});
    continueOnWriter([this, caller] { registerPaths(caller); });
}

void Transaction::registerPaths(std::optional<UserIdentity> caller) {
    processPaths(
        [this, &caller](const std::string& path, bool resolved) {
            if (!resolved) {
                fail(ErrorCode::BadPath, formatPrintf("invalid plugin path: %@", path));
                return false;
            }
            trace::pluginAdd(path.c_str());
            if (std::optional<Error> error = server()->addPlugIn(path, caller)) {
                log::ops().notice("failed to register plug-in at %@", path);
                // The database's own wording stays in the log; the client learns only which path failed.
                fail(ErrorCode::RegistryRefused, formatPrintf("unable to register plug-in at %@", path));
                return false;
            }
            return true;
        },
        caller);
}

void Transaction::removePlugIns() {
    // The entitlement is read here, on the request queue, where the client's identity lives.
    const bool entitled = client()->hasEntitlement(protocol::kManagerEntitlement);
    continueOnWriter([this, entitled] { unregisterPaths(entitled); });
}

void Transaction::unregisterPaths(bool entitled) {
    processPaths([this, entitled](const std::string& path, bool resolved) {
        trace::pluginRemove(path.c_str(), resolved);
        if (!entitled) {
            log::defaultLog().notice(
                "refused request from pid=%d to remove plug-in at %@ - client lacks required entitlement",
                client()->pid(), path);
            fail(ErrorCode::NotAllowed, "caller lacks entitlement for this operation");
            return false;
        }
        // An unresolved path goes to the registry as the client sent it: the bundle may already be deleted.
        if (server()->removePlugIn(path)) {
            fail(ErrorCode::BadPath, formatPrintf("no plugin at %@", path));
            return false;
        }
        return true;
    });
}

void Transaction::bulkPlugIns() {
    uint64_t flags = request().get(protocol::key::kFlags).numberAsUInt64().value_or(0);
    log::ops().info("bulk options 0x%lx not supported", static_cast<unsigned long>(flags));
    done();
}

}  // namespace bexil
