#include "platform/linux/TransportBudget.h"

namespace platform::linux_::qmx {

bool Budget::Share::resize(std::size_t size) {
    if (_account && size != _size && !_account->budget->exchange(*_account, _size, size)) return false;
    _size = size;
    return true;
}

Budget::Account::~Account() {
    const std::lock_guard lock(budget->_mutex);
    const auto found = budget->_accounts.find(user);
    // Another one may have been opened for the user meanwhile.
    if (found != budget->_accounts.end() && found->second.expired()) budget->_accounts.erase(found);
}

Budget::Share Budget::shareOf(std::uint32_t user) {
    const std::lock_guard lock(_mutex);
    auto& place = _accounts[user];
    auto account = place.lock();
    if (!account) place = account = std::shared_ptr<Account>(new Account{shared_from_this(), user});
    return Share(std::move(account));
}

bool Budget::exchange(Account& account, std::size_t before, std::size_t after) {
    const std::lock_guard lock(_mutex);
    const std::size_t others = account.size - before;
    const std::size_t elsewhere = _total - before;
    // What shrinks is always granted. Differences, for sums could wrap around. What is held may exceed the overall
    // limit by ordinary shares.
    const bool isGranted =
        after <= before ||
        (after <= _limits.perUser - others &&
         (after <= _limits.ordinaryShare || (elsewhere <= _limits.overall && after <= _limits.overall - elsewhere)));
    if (!isGranted) return false;
    account.size = others + after;
    _total = elsewhere + after;
    return true;
}

} // namespace platform::linux_::qmx
