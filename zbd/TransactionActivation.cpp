#include "zbd/Transaction.h"

namespace zbd {

void Transaction::readyPlugIns() { fail(zembra::code::malformed, "\"ready\" is not served by this version"); }

void Transaction::accessPlugIns() { fail(zembra::code::malformed, "\"access\" is not served by this version"); }

} // namespace zbd
