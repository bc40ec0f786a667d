#pragma once

// A walk over the objects that an object refers to. An object reports each
// reference it holds (its VisitObjects slot); a reference presents the object
// it designates to the visitor.
//
// VisitObject receives a handle to look at. VisitEvictableObject receives the
// handle by reference: a visitor that releases the object (an evictor) sets it
// to null, and the reference that presented it forgets its binding, so the
// next use loads the object again.

#include "tnObject/IObject.h"

namespace tarn {

class IObjectVisitor {
public:
    virtual void VisitObject(ptr<const IObject> obj) = 0;
    virtual void VisitEvictableObject(ptr<const IObject>& obj) = 0;

protected:
    ~IObjectVisitor() = default;
};

}  // namespace tarn
