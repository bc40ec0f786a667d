#include "tnRuntime/RuntimeCallLog.h"

namespace tarn {

RuntimeCallLog& GetThreadRuntimeCallLog() {
    thread_local RuntimeCallLog log;
    return log;
}

}  // namespace tarn
