#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <utility>

namespace platform::linux_::qmx {

/// Of something that peers make this process hold: how much all users together may have, and each of them.
class Budget : public std::enable_shared_from_this<Budget> {
    struct Account;

public:
    struct Limits {
        std::size_t perUser;
        std::size_t overall = std::numeric_limits<std::size_t>::max();
        /// A share up to this size is granted though `overall` is used up, so that users who fill it do not shut the
        /// others out.
        std::size_t ordinaryShare = 0;
    };

    /// What one holder has of a user's part; given back when it goes. One that was default-made is counted nowhere.
    /// Shares of one budget may be used on different threads; one share on one thread at a time.
    class Share {
    public:
        Share() = default;
        Share(Share&& other) noexcept : _account(std::move(other._account)), _size(std::exchange(other._size, 0)) {}
        Share& operator=(Share&& other) noexcept {
            std::swap(_account, other._account);
            std::swap(_size, other._size);
            return *this;
        }
        ~Share() { resize(0); }

        /// False, and nothing changed, when that is too much.
        bool resize(std::size_t size);
        /// An empty share of the same user.
        Share sibling() const { return Share(_account); }

    private:
        friend class Budget;
        explicit Share(std::shared_ptr<Account> account) : _account(std::move(account)) {}

        std::shared_ptr<Account> _account;
        std::size_t _size = 0;
    };

    explicit Budget(const Limits& limits) : _limits(limits) {}

    /// An empty share.
    Share shareOf(std::uint32_t user);

private:
    /// All that one user has.
    struct Account {
        ~Account();
        const std::shared_ptr<Budget> budget;
        const std::uint32_t user;
        std::size_t size = 0; // guarded by the budget's mutex
    };

    bool exchange(Account& account, std::size_t before, std::size_t after);

    const Limits _limits;
    std::mutex _mutex;
    // Guarded by _mutex.
    std::size_t _total = 0;
    std::unordered_map<std::uint32_t, std::weak_ptr<Account>> _accounts;
};

} // namespace platform::linux_::qmx
