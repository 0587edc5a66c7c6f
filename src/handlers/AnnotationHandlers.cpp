// The requests that change plug-in annotations: "annotate" (an election and/or client data for plug-ins named by
// UUID) and "bulk-annotate" (client data for many plug-ins keyed by UUID text). Neither checks an entitlement: any
// client may change the annotations of any plug-in it can name. Changes are made in memory one plug-in at a time,
// so when a later plug-in fails the earlier ones keep their change; the document is then written once on the
// database's writer queue (together with whatever other changes are waiting for it), and the reply, a failure
// included, goes out only after that write. Other processes are told through the change notification only when the
// whole request succeeded.

#include <memory>
#include <optional>
#include <string>

#include "bexil/Protocol.h"
#include "daemon/BXDServer.h"
#include "daemon/BXDZemClient.h"
#include "daemon/Transaction.h"
#include "platform/log/Log.h"
#include "policy/BXDPlugIn.h"

namespace bexil {

namespace {

constexpr std::string_view kAnnotationsKey = protocol::key::kAnnotations;
constexpr std::string_view kElectionKey = protocol::annotation::kElection;
constexpr std::string_view kExtensionKey = protocol::annotation::kExtension;

// An election must be a number. Booleans are numbers here, as everywhere a value is read as one: a stored true is
// read back as the election 1, false as 0; only values of other kinds are refused.
bool isElectionNumber(const Value& value) { return value.isNumber(); }

std::string uuidText(const BXDPlugIn& plugIn) {
    std::optional<Uuid> uuid = plugIn.uuid();
    return uuid ? uuid->string() : std::string("(null)");
}

}  // namespace

void Transaction::annotatePlugIns() {
    std::optional<Value> annotations = zem_dictionary_get_dictionary(request(), kAnnotationsKey);
    if (!annotations) {
        fail(ErrorCode::InvalidRequest, "invalid request format (bad annotations dictionary)");
        return;
    }

    // Only the two known keys become part of the change; anything else the client sent is ignored.
    MutableDictionary change;
    if (const Value* election = annotations->find(kElectionKey)) {
        if (!isElectionNumber(*election)) {
            fail(ErrorCode::InvalidRequest, "invalid request format (annotation election)");
            return;
        }
        change.set(kElectionKey, *election);
    }
    if (const Value* extension = annotations->find(kExtensionKey)) {
        if (!extension->isDictionary()) {
            fail(ErrorCode::InvalidRequest, "invalid request format (annotation extension)");
            return;
        }
        change.set(kExtensionKey, *extension);
    }
    if (change.count() == 0) {
        // Nothing to change: the plug-in list is not even read, and nobody needs to be told.
        done();
        return;
    }

    const Value changeValue = change.take();
    const Value* newElection = changeValue.find(kElectionKey);
    const pid_t pid = client()->pid();
    holdReply();
    std::vector<std::shared_ptr<BXDPlugIn>> changed;
    bool walked = processUuidList([&](const std::shared_ptr<BXDPlugIn>& plugIn) {
        std::optional<std::string> identifier = plugIn->identifier();
        std::string uuid = uuidText(*plugIn);
        log::ops().debug("client %d plug-in %@(%{public}@) annotation change: %@", pid, identifier, uuid, changeValue);
        if (newElection != nullptr)
            log::ops().info("client %d plug-in %@(%{public}@) election := %@", pid, identifier, uuid, *newElection);
        server()->changeAnnotationForPlugIn(changeValue, *plugIn);
        changed.push_back(plugIn);
        return true;
    });
    saveAnnotationsThenAnswer(walked, std::move(changed));
}

void Transaction::saveAnnotationsThenAnswer(bool succeeded, std::vector<std::shared_ptr<BXDPlugIn>> changed) {
    continueOnWriter([this] { server()->saveAnnotations(); },
                     [this, succeeded, changed = std::move(changed)] {
                         if (!changed.empty()) server()->publishChange(Change::Kind::Annotated, changed);
                         if (!succeeded) return;
                         server()->notifyAnnotationChange();
                         done();
                     });
}

void Transaction::bulkAnnotatePlugIns() {
    std::optional<Value> annotations = zem_dictionary_get_dictionary(request(), kAnnotationsKey);
    if (!annotations) {
        fail(ErrorCode::InvalidRequest, "invalid request format (bad annotations dictionary)");
        return;
    }
    log::ops().debug("bulk change requested for %u plug-ins", annotations->count());

    const pid_t pid = client()->pid();
    holdReply();
    std::vector<std::shared_ptr<BXDPlugIn>> changed;
    for (const DictionaryEntry& entry : annotations->entries()) {
        if (!entry.value.isDictionary()) {
            fail(ErrorCode::BadBulkAnnotation, "annotations values must be dictionaries");
            saveAnnotationsThenAnswer(false, std::move(changed));
            return;
        }
        std::optional<Uuid> uuid = Uuid::parse(entry.key);
        if (!uuid) {
            fail(ErrorCode::BadBulkAnnotation, "invalid plug-in UUID value");
            saveAnnotationsThenAnswer(false, std::move(changed));
            return;
        }
        std::shared_ptr<BXDPlugIn> plugIn = server()->findPlugIn(*uuid);
        if (!plugIn) {
            fail(ErrorCode::RegistryRefused, "no plug-in with the requested uuid");
            saveAnnotationsThenAnswer(false, std::move(changed));
            return;
        }
        log::ops().debug("client %d bulk plug-in %@(%{public}@) annotation change: %@", pid, plugIn->identifier(),
                         uuid->string(), entry.value);
        // The whole "extension" annotation is replaced; the election is a separate key and stays.
        server()->changeAnnotationForPlugIn(Value::dictionary({{std::string(kExtensionKey), entry.value}}), *plugIn);
        changed.push_back(std::move(plugIn));
    }
    saveAnnotationsThenAnswer(true, std::move(changed));
}

void Transaction::addAnnotationForPlugInIn(const BXDPlugIn& plugIn, MutableDictionary& entry) {
    server()->addAnnotationForPlugInIn(plugIn, entry);
}

}  // namespace bexil
