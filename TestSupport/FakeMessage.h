// A client's message, and the one reply that it gets.
#pragma once

#include <gtest/gtest.h>

#include <utility>

#include "Platform/bus/BusPeer.h"
#include "Platform/runtime/Transactions.h"
#include "Values/ValueStream.h"

namespace veltoid {

class FakeMessage : public platform::IncomingMessage {
  public:
    explicit FakeMessage(Dictionary request) : request_(std::move(request)) {}

    std::optional<int64_t> peekInteger(std::string_view key) override { return request_[key].asInt64(); }
    void read(platform::ValueSink& sink) override {
        EXPECT_GT(platform::transactions::openCount(), 0) << "the agent must not leave now";
        writeValue(request_, sink);
    }
    void reply(platform::ValueWriter writer) override {
        ValueBuilder builder;
        writer(builder);
        EXPECT_EQ(replies_++, 0) << "one reply to a request";
        EXPECT_TRUE(builder.value().isDictionary());
        if (const Dictionary* dictionary = builder.value().asDictionary()) reply_ = *dictionary;
    }

    const Dictionary& reply() const { return reply_; }
    int replies() const { return replies_; }

  private:
    Dictionary request_;
    Dictionary reply_;
    int replies_ = 0;
};

}  // namespace veltoid
