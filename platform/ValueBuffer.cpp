#include "platform/ValueBuffer.h"

#include <cstring>
#include <new>

namespace ostrel {

const std::shared_ptr<PayloadAccount> ValueBuffer::kNoAccount;

ValueBuffer ValueBuffer::makeUncharged(std::size_t size,
                                       std::shared_ptr<PayloadAccount> account) {
  void* memory = ::operator new(sizeof(Header) + size);
  auto* header = new (memory) Header;
  header->size = size;
  header->account = std::move(account);
  ValueBuffer buffer;
  buffer.header_ = header;
  return buffer;
}

ValueBuffer ValueBuffer::make(std::size_t size, std::shared_ptr<PayloadAccount> account) {
  ValueBuffer buffer = makeUncharged(size, std::move(account));
  buffer.charge(buffer.memory());
  return buffer;
}

ValueBuffer ValueBuffer::copyOf(std::span<const std::uint8_t> bytes,
                                std::shared_ptr<PayloadAccount> account) {
  ValueBuffer buffer = make(bytes.size(), std::move(account));
  std::memcpy(buffer.data(), bytes.data(), bytes.size());
  return buffer;
}

ValueBuffer ValueBuffer::copyOfInput(std::span<const std::uint8_t> bytes,
                                     std::shared_ptr<PayloadAccount> account) {
  ValueBuffer buffer = makeUncharged(bytes.size() + kReadableBytes, std::move(account));
  std::memcpy(buffer.data(), bytes.data(), bytes.size());
  std::memset(buffer.data() + bytes.size(), 0, kReadableBytes);
  return buffer;
}

void ValueBuffer::destroy(Header* header) noexcept {
  const std::shared_ptr<PayloadAccount> account = std::move(header->account);
  const std::size_t charged = header->charged;
  header->~Header();
  ::operator delete(header);
  if (account) account->relieve(charged);
}

}  // namespace ostrel
