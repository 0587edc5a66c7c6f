#include "platform/ledgerix/LXApplicationProxy.h"

#include <utility>

#include "platform/ledgerix/LXBexilProxy.h"

namespace bexil {

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInLoader loader)
    : bundleURL_(Value::string(std::move(fields.bundleURL))), fields_(std::move(fields)), loader_(std::move(loader)) {}

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInList plugIns)
    : bundleURL_(Value::string(std::move(fields.bundleURL))),
      fields_(std::move(fields)),
      plugIns_(std::move(plugIns)),
      plugInsRead_(true) {}

const LXApplicationProxy::PlugInList& LXApplicationProxy::plugIns() const {
    std::call_once(loaded_, [this] {
        // Marked before the loader runs: the records it builds must not share this one, or this record would hold
        // itself through its own list and never be freed.
        plugInsRead_.store(true, std::memory_order_release);
        if (loader_) {
            plugIns_ = loader_();
            // The loader may hold the registry alive; it is not needed any more.
            loader_ = nullptr;
        }
    });
    return plugIns_;
}

std::string LXApplicationProxy::description() const {
    std::string text = "<application ";
    text += fields_.bundleIdentifier.value_or("(no identifier)");
    text += ' ';
    text += bundleURL();
    if (fields_.isPlaceholder) text += " placeholder";
    text += '>';
    return text;
}

}  // namespace bexil
