#pragma once

// The store's vector time over sites. Declared, not defined, in this library
// (see tnOT/TVectorTime.h).

#include "tnOT/TVectorTime.h"
#include "tnOperation/src/Util/Opid.h"
#include "tnUtils/Guid.h"

namespace tarn {

using VectorTime = TVectorTime<SiteNum, GenSeqNum>;

}  // namespace tarn
