#include "zbd/ZBDPlugInHold.h"

namespace zbd {

std::shared_ptr<ZBDPlugInHold> ZBDPlugInHold::initWithPlugIns(platform::Transport& transport,
                                                              const std::vector<ZBDPlugInRef>& plugIns,
                                                              const std::shared_ptr<ZBDQmxClient>& client) {
    std::shared_ptr<ZBDPlugInHold> hold(new ZBDPlugInHold);
    hold->_blocked.insert(plugIns.begin(), plugIns.end());
    hold->_client = client;
    hold->_activity = transport.beginActivity("plug-in hold " + hold->_uuid.text());
    return hold;
}

} // namespace zbd
