// Connections of one user, for the tests of what they may have.
#pragma once

#include <gtest/gtest.h>

#include <cstddef>
#include <memory>

#include "platform/linux/PeerChannel.h"

namespace ostrel::testing_support {

/// The user may have 100 bytes under way, each of the connections 60.
class ChannelsOfAUser : public testing::Test {
 protected:
  static constexpr UserAccount::Limits kLimitsOfUser{/*queuedBytes=*/100, /*sessions=*/10,
                                                     /*keptBytes=*/500};

  /// With so many unread bytes on each connection.
  explicit ChannelsOfAUser(std::size_t unreadBytes)
      : ChannelsOfAUser(unreadBytes, kLimitsOfUser) {}
  ChannelsOfAUser(std::size_t unreadBytes, const UserAccount::Limits& ofUser)
      : user_(std::make_shared<UserAccount>(ofUser, service_)),
        limits_{/*queuedBytes=*/60, unreadBytes} {}

  PeerChannel makeChannel(LoopWaker::ConnectionID id) const {
    return PeerChannel(id, waker_, user_, limits_);
  }

  const std::shared_ptr<LoopWaker> waker_ = std::make_shared<LoopWaker>();
  const std::shared_ptr<ServiceAccount> service_{
      new ServiceAccount{Share(10), Share(1000)}};
  const std::shared_ptr<UserAccount> user_;
  const PeerChannel::Limits limits_;
};

}  // namespace ostrel::testing_support
