#pragma once

#include "tnOT/TOpid.h"
#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn {

// The sequence number of an operation within its site's history.
using GenSeqNum = int64;

using Opid = TOpid<SiteNum, GenSeqNum>;

}  // namespace tarn
