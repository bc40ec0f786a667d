// Assigns an object's address to an untyped persistent reference, which
// only takes null: the reference's header stops the program.

#include "tnPersistStore/pref.h"

int main() {
    int object = 0;
    tarn::cref<void> ref;
    ref = static_cast<void*>(&object);
    return 0;
}
