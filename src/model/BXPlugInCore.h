#pragma once

// BXPlugInCore is the one description of a plug-in that the database caches, the match rules test and replies carry
// in serialised form. It names a bundle, holds its information dictionaries and the facts its builder supplied, and
// derives the plug-in's configuration from three primitive look-ups (infoKey, pluginKey, attribute) that a subclass
// may redirect. Records are shared through std::shared_ptr between queues: each stored property is read and written
// atomically on its own (under one of a fixed set of locks, never held across records or while calling out), so any
// thread may read a record while another replaces, say, its annotations.
//
// URLs are kept as file-system paths (std::string): every URL a record holds is a file URL, and the path is all that
// anyone reads from it. Dictionaries are Values holding a dictionary, shared by reference count and never edited in
// place; an absent dictionary is an empty std::optional.

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Value.h"

namespace bexil {

class BXInterface;

class BXPlugInCore {
  public:
    // `init`: an empty record with no property set. Set it up with one of the setup operations before sharing it.
    BXPlugInCore() = default;
    virtual ~BXPlugInCore() = default;
    BXPlugInCore(const BXPlugInCore&) = delete;
    BXPlugInCore& operator=(const BXPlugInCore&) = delete;

    // ---- Construction ----

    // A set-up record, or an empty pointer when set-up fails. When set-up succeeded and the record still has no
    // plug-in dictionary, `info` (when it is a dictionary) becomes it; this is the only place that reads `info`.
    static std::shared_ptr<BXPlugInCore> initWithNameUrlBundleInfoInfoUuid(std::optional<std::string> identifier,
                                                                           std::optional<std::string> url,
                                                                           std::optional<Value> bundleInfo,
                                                                           std::optional<Value> info,
                                                                           std::optional<Uuid> uuid);
    // A record read from its serialised form, or an empty pointer when the form cannot be read.
    static std::shared_ptr<BXPlugInCore> initWithForm(const Value& form);

    // Sets the record up from names and dictionaries; false when the URL or identifier is missing or the information
    // dictionary is malformed (logged, except for a missing URL). `info` is not used here. A missing UUID is replaced
    // by a fresh random one.
    virtual bool setupWithNameUrlBundleInfoInfoUuid(std::optional<std::string> identifier,
                                                    std::optional<std::string> url, std::optional<Value> bundleInfo,
                                                    std::optional<Value> info, std::optional<Uuid> uuid);
    // Sets the record up from a serialised form. Entries of an unexpected kind read as absent and take their
    // defaults; only "identifier", "path" and a present "bundleInfo" can make reading fail.
    virtual bool setupWithForm(const Value& form);

    // ---- Dictionaries ----

    // Stores `info` as the information dictionary and its "RZExtension" entry as the plug-in dictionary. False when
    // `info` is not a dictionary (nothing changes) or its "RZExtension" is not one (the information dictionary stays
    // stored, the plug-in dictionary is unchanged).
    virtual bool setDictionaries(const Value& info);
    // Hook run on an information dictionary before setDictionaries during set-up; the base record keeps it as is.
    virtual Value normalizeInfoDictionary(const Value& info);
    // Rewrites the plug-in dictionary so that it holds an attributes dictionary with an "RZExtensionVersion".
    virtual void canonicalize();

    // ---- SDK resolution ----
    //
    // Every plug-in names its extension point; the point's SDK dictionary supplies the defaults the plug-in does not
    // state. Resolution is for records that hold their own information dictionary (built by a client from a bundle
    // or a form) and runs while the record is being built, before it is shared; the daemon's records never run it.

    // The SDK dictionary registered under `name` in the process's extension-SDK registry, or nothing (logged).
    // Static, as the registry is the process's: a record that must look elsewhere replaces the registry instead.
    static std::optional<Value> readSDKDictionary(std::string_view name);
    // Merges the SDK named by sdkSpec under the information dictionary (which becomes the merged one, its
    // "RZExtension" entry the plug-in dictionary), then canonicalizes. A record without an information dictionary
    // is an internal fault, reported like the record's others (fault level on the ops channel, naming the operation
    // and the record): nothing is merged, and it is still canonicalized. A name that is not a string is logged and
    // leaves the record entirely unchanged.
    virtual void resolveSDK();
    // A new dictionary: `plugIn` with what `sdk` adds. Keys only on one side are kept; where both have a key the
    // plug-in's value wins, except that sdkOverridesKey keys take the SDK's value, "Shared" takes the union, and two
    // dictionaries merge by these rules at any depth. Where the SDK holds a dictionary and the plug-in something
    // else, the plug-in's value is kept: the SDK cannot reshape what the plug-in wrote. Neither input changes.
    virtual Value mergeDictionaryInto(const Value& sdk, const Value& plugIn) const;
    // True for the keys whose SDK value replaces the plug-in's own: "CleanTimeout" alone.
    virtual bool sdkOverridesKey(std::string_view key) const;
    // The union of two shared-resource lists, each distinct path once: the plug-in's in its order, then the SDK's
    // that it lacks. A single path string counts as a list of that path, since "Shared" may be written either way;
    // when either side is neither, the plug-in's value is kept as it is.
    virtual Value mergeSharedResourcesInto(const Value& sdk, const Value& plugIn) const;

    // ---- Form ----

    // The serialised form. Never fails today; callers check the result all the same. An entry whose record value is
    // missing (a record that was never fully set up) is left out rather than invented.
    virtual Result<MutableDictionary> exportForm() const;
    // Replaces the annotations by the form's "annotations" entry; no such dictionary there makes them absent.
    virtual void updateFromForm(const Value& form);

    // ---- Checks and annotations ----

    // Nothing when the record is usable, else an error of code 12 saying why. Never logs.
    virtual std::optional<Error> diagnose() const;
    // Replaces the annotations by a copy in which `key` maps to `value` (or is removed when `value` is nothing). A
    // record without annotations keeps none. The change is one atomic step: concurrent changes are never lost.
    virtual void setAnnotationValue(std::string_view key, const std::optional<Value>& value);

    // ---- Identity ----

    // True exactly when `other` (a record of this class or any subclass) has this record's UUID. REQUIRES: this
    // record has a UUID; otherwise throws InternalInconsistency("self.uuid").
    virtual bool isEqual(const BXPlugInCore& other) const;
    // The hash of the UUID. REQUIRES: this record has a UUID; otherwise throws InternalInconsistency("self.uuid").
    virtual size_t hash() const;
    bool operator==(const BXPlugInCore& other) const { return isEqual(other); }

    // ---- Primitive look-ups: every derived property goes through these ----

    virtual std::optional<Value> infoKey(std::string_view key) const;
    virtual std::optional<Value> pluginKey(std::string_view key) const;
    virtual std::optional<Value> attribute(std::string_view key) const;
    // A hook for a kind of plug-in whose connections need more than its protocol and spec strings describe; it may
    // refine `interface`. The record itself changes nothing and never fails.
    virtual std::optional<Error> augmentInterface(BXInterface& interface) const;

    // ---- Derived properties ----

    virtual std::optional<std::string> path() const;
    virtual std::optional<std::string> containingPath() const;
    virtual std::optional<Value> attributes() const;
    virtual std::optional<Value> version() const;
    // A protocol name or an array of names; "RZObject" for an application extension that names none.
    virtual std::optional<Value> protocolSpec() const;
    virtual std::optional<Value> principalSpec() const;
    virtual std::optional<Value> sdkSpec() const;
    virtual std::optional<std::string> embeddedCodePath() const;
    virtual std::optional<Value> embeddedProtocolSpec() const;
    virtual bool isAppExtension() const;
    virtual bool isMultiplexed() const;
    virtual bool isHybrid() const;
    virtual bool isDedicated() const;
    virtual bool isData() const;
    // Every plug-in is old-style or current-style; a record that is neither is reported as an internal fault on the
    // ops channel and answers true.
    virtual bool oldStyle() const;
    virtual Date timestamp() const;

    // "<BXPlugInCore identifier uuid path>" for log lines.
    virtual std::string description() const;

    // ---- Stored properties (each read and written atomically) ----

    std::optional<std::string> identifier() const;
    void setIdentifier(std::optional<std::string> v);
    std::optional<std::string> originalIdentifier() const;
    void setOriginalIdentifier(std::optional<std::string> v);
    // File URL of the bundle, as its path.
    std::optional<std::string> url() const;
    void setUrl(std::optional<std::string> v);
    // The four below are virtual so that a record backed by another source (the registry) can answer them.
    virtual std::optional<Value> bundleInfoDictionary() const;
    void setBundleInfoDictionary(std::optional<Value> v);
    virtual std::optional<Value> plugInDictionary() const;
    virtual void setPlugInDictionary(std::optional<Value> v);
    std::optional<Value> entitlements() const;
    void setEntitlements(std::optional<Value> v);
    std::optional<Value> annotations() const;
    void setAnnotations(std::optional<Value> v);
    // File URL of the containing application's bundle, as its path.
    std::optional<std::string> containingUrl() const;
    void setContainingUrl(std::optional<std::string> v);
    bool onSystemVolume() const;
    void setOnSystemVolume(bool v);
    uint32_t hubProtocolVersion() const;
    void setHubProtocolVersion(uint32_t v);
    virtual std::optional<std::string> localizedName() const;
    void setLocalizedName(std::optional<std::string> v);
    virtual std::optional<std::string> localizedShortName() const;
    void setLocalizedShortName(std::optional<std::string> v);
    virtual std::optional<std::string> localizedContainingName() const;
    void setLocalizedContainingName(std::optional<std::string> v);
    int32_t lastModified() const;
    void setLastModified(int32_t v);
    std::optional<Uuid> uuid() const;
    void setUuid(std::optional<Uuid> v);
    // Data value (20 bytes when present); carried, never computed here.
    std::optional<Value> cdhash() const;
    void setCdhash(std::optional<Value> v);
    std::optional<std::string> requirement() const;
    void setRequirement(std::optional<std::string> v);

  protected:
    // Counterparts of the text setters for a string Value made elsewhere (the registry's record), which the record
    // then shares instead of keeping a copy of its own. Anything but a string makes the property absent.
    void shareIdentifier(const Value& text);
    void shareOriginalIdentifier(const Value& text);
    void shareUrl(const Value& text);
    void shareContainingUrl(const Value& text);
    void shareLocalizedName(const Value& text);
    void shareLocalizedShortName(const Value& text);

    // Reads and replaces one stored property under the record's lock; subclasses keep their own lazily made
    // properties the same way, without a lock of their own.
    template <typename T>
    T load(const T& field) const {
        std::lock_guard<std::mutex> guard(mutex());
        return field;
    }
    template <typename T>
    void store(T& field, T value) {
        // The old value is released outside the lock: dropping the last reference to a large dictionary may take a
        // while and must not stall readers of the other properties.
        {
            std::lock_guard<std::mutex> guard(mutex());
            std::swap(field, value);
        }
    }

  private:
    // Text properties are kept as string Values so that exporting and reading forms share them instead of copying.
    // Text properties hold only strings, so a null Value stands for an absent one (8 bytes less per property than
    // an optional, which a cache of many records notices).
    std::optional<std::string> loadText(const Value& field) const;
    static Value textValue(std::optional<std::string> text);
    static Value textEntry(const Value& form, std::string_view key);
    static Value sharedText(const Value& text);
    // One lock of a fixed set, chosen by the record's address: records are many, and a lock each would be a large
    // part of one. Never held while taking another, so records sharing one cannot deadlock.
    std::mutex& mutex() const;

    Value identifier_;
    Value originalIdentifier_;
    Value url_;
    std::optional<Value> bundleInfoDictionary_;
    std::optional<Value> plugInDictionary_;
    std::optional<Value> entitlements_;
    std::optional<Value> annotations_;
    Value containingUrl_;
    bool onSystemVolume_ = false;
    uint32_t hubProtocolVersion_ = 0;
    Value localizedName_;
    Value localizedShortName_;
    Value localizedContainingName_;
    int32_t lastModified_ = 0;
    std::optional<Uuid> uuid_;
    std::optional<Value> cdhash_;
    Value requirement_;
};

// Identity of records by UUID, for std::unordered_set/map keyed by shared records. An empty pointer equals only an
// empty pointer; a record without a UUID throws InternalInconsistency("self.uuid").
struct BXPlugInCoreHash {
    size_t operator()(const BXPlugInCore* record) const;
    template <typename T>
    size_t operator()(const std::shared_ptr<T>& record) const {
        return (*this)(static_cast<const BXPlugInCore*>(record.get()));
    }
};
struct BXPlugInCoreEqual {
    bool operator()(const BXPlugInCore* a, const BXPlugInCore* b) const;
    template <typename T, typename U>
    bool operator()(const std::shared_ptr<T>& a, const std::shared_ptr<U>& b) const {
        return (*this)(static_cast<const BXPlugInCore*>(a.get()), static_cast<const BXPlugInCore*>(b.get()));
    }
};

}  // namespace bexil

template <>
struct std::hash<bexil::BXPlugInCore> {
    size_t operator()(const bexil::BXPlugInCore& record) const { return record.hash(); }
};
