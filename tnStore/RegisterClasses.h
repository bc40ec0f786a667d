#pragma once

namespace tarn {

// Registers the reflection records of the offset-operations classes (the
// record, the map header and both node kinds) with the runtime's class
// registry, so that stored images of them can be loaded by class name.
// Also enters the bounds-checked image check of each class, which the loader
// runs before a class's reader sees an image from a store. Runs exactly once
// per process; later calls do nothing. The runtime knows no class by itself:
// whoever opens a space over stored records (the embedding API, a test, a
// benchmark) calls it before the space loads or creates one of them by name.
void RegisterOffsetOpsClasses();

}  // namespace tarn
