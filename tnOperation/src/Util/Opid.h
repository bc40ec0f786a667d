#pragma once

#include "tnOT/TOpid.h"
#include "tnUtils/Guid.h"
#include "tnUtils/Types.h"

namespace tarn {

using Opid = TOpid<Guid, int64>;

}  // namespace tarn
