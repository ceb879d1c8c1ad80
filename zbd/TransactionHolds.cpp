#include "zbd/Transaction.h"

namespace zbd {

void Transaction::lockDownPlugIns() { fail(zembra::code::malformed, "\"lock\" is not served by this version"); }

} // namespace zbd
