#pragma once

// A walk over the persistent references along which stored objects form a
// tree (each object reached from exactly one parent): an object reports them
// through its VisitPrefs slot. The runtime uses it to find everything below
// an object handed to AsyncPermanentlyDeleteSubTree. Empty references are
// reported too; the visitor skips them.

namespace tarn {

class prefbase;

class IPrefVisitor {
public:
    virtual void VisitPref(const prefbase& ref) = 0;
    virtual void VisitParentPref(const prefbase& ref) = 0;

protected:
    ~IPrefVisitor() = default;
};

}  // namespace tarn
