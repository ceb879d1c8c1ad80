#include "zbd/Transaction.h"

namespace zbd {

void Transaction::matchPlugIns() { fail(zembra::code::malformed, "\"match\" is not served by this version"); }

} // namespace zbd
