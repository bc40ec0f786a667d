#pragma once

namespace tarn {

// Registers the reflection records of the offset-operations classes (the
// record, the map header and both node kinds) with the runtime's class
// registry, so that stored images of them can be loaded by class name.
// Runs the four registration functions exactly once per process; later
// calls do nothing. Every object space calls it when it is created.
void RegisterOffsetOpsClasses();

}  // namespace tarn
