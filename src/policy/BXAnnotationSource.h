#pragma once

// BXAnnotationSource gives the match rules a plug-in's stored annotation, from which they read the user's election.
// The annotations live in the database, a layer above the rules; the database's server implements this interface
// and the rules reach it only through it. Implementations are called on the evaluating thread and may block
// briefly (the database enters its own queue), so rules must never be evaluated from inside that queue.

#include "bexil/Value.h"
#include "model/BXPlugInCore.h"

namespace bexil {

class BXAnnotationSource {
  public:
    virtual ~BXAnnotationSource() = default;
    // The plug-in's annotation dictionary, or null when it has none.
    virtual Value annotationForPlugIn(const BXPlugInCore& plugIn) const = 0;
};

}  // namespace bexil
