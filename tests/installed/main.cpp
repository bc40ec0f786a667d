// Asks a cursor standing at the end of an empty store for its key, a misuse
// that the cursor's installed header stops the program for.

#include "tnStore/FieldCursor.h"

int main() {
    tarn::OffsetOpsStore store = tarn::OffsetOpsStore::OpenInMemory();
    tarn::FieldCursor cursor(store);
    return cursor.Key().oid.IsNull() ? 0 : 1;
}
