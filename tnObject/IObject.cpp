#include "tnObject/IObject.h"

namespace tarn {

// The one constant that stands for "no object".
const NullInterface null;

const ReflectedInterface& _GetReflected(const IObject*) {
    static const ReflectedInterface record{"tarn::IObject"};
    return record;
}

}  // namespace tarn
