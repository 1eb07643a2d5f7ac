// The guard with which the agent keeps itself alive while work is pending.
#pragma once

#include <string>

#include "Platform/runtime/Transactions.h"

namespace veltoid {

/// Open from construction to close or destruction. Any thread.
class Transaction {
  public:
    explicit Transaction(std::string name = "-") : name_(std::move(name)) { platform::transactions::began(); }
    ~Transaction() { close(); }
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    void close() {
        if (open_) platform::transactions::ended();
        open_ = false;
    }

    /// For one who gives it up while waiting.
    void reopen() {
        if (!open_) platform::transactions::began();
        open_ = true;
    }

    const std::string& name() const { return name_; }

  private:
    std::string name_;
    bool open_ = true;
};

}  // namespace veltoid
