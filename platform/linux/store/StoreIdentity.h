#pragma once

namespace ostrel {

/// Under this key the table `service_status` holds what tells a store from any other: a
/// text that is drawn for its first commit and never changes.
inline constexpr const char* kStoreIdentityKey = "store_id";

}  // namespace ostrel
