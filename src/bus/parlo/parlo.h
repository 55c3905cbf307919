// Interface of parlo.dll, the in-process messaging library that carries the
// channels of every bus. Shared by the component, by hosts that do their
// messaging on a bus's messaging object, and by the stand-in library under
// siblings/parlo.
//
// The objects are the library's: no destructor slots, callers never delete
// them. A bus lives from create_bus to destroy_bus; its channels live as long
// as the bus; a subscription lives from create_subscription to
// destroy_subscription (or destroy_bus); a message the caller created lives
// until the caller releases it, independently of the bus it came from.
//
// The slot order of each class is a binary contract with the library and
// with other builds of it: never reorder, insert or remove a slot. The
// reserved slots hold places; they return error_not_implemented.
//
// Threads: every operation may be called from any thread. Subscription
// callbacks run on the bus's own delivery thread, never on the thread that
// posted. All callbacks of one bus run on that one thread, one at a time; on
// each channel they see the messages in the order in which the posts
// returned. See parlo_ext.h for the additional exports the IPC library uses.
//
// Waiting: destroy_subscription, parlo_untap and destroy_bus wait for a
// callback of theirs that is running on the delivery thread to return, so
// the caller must not hold a lock that such a callback takes. From inside a
// callback of the same bus nothing waits (see each operation); a callback
// that ends something of another bus waits for that bus's thread, and two
// buses whose callbacks do this to each other deadlock.
//
// Strings are narrow, zero-terminated UTF-8. Names (channels, bus, blob
// fields) are 1 to max_name_length bytes.
#pragma once

#include <cstdint>

namespace parlo {

// Results: 0 for success, otherwise a Win32 error code.
inline constexpr std::uint32_t success = 0;
// The message is sealed, or delivered by the library and so read-only.
inline constexpr std::uint32_t error_access_denied = 5;
// The library could not allocate what the call needs.
inline constexpr std::uint32_t error_not_enough_memory = 8;
// Bytes that do not decode as a message (parlo_ext.h); a message one of
// whose set_blob calls was refused (post: it is not what its caller built).
inline constexpr std::uint32_t error_invalid_data = 13;
// A reserved slot.
inline constexpr std::uint32_t error_not_implemented = 120;
// A null argument, a name that is empty or too long, an object that the
// library did not create or that was already released, an unknown flag.
inline constexpr std::uint32_t error_invalid_parameter = 87;
// flush was called on the bus's own delivery thread, where it would wait
// for itself.
inline constexpr std::uint32_t error_possible_deadlock = 1131;
// A name or object that is well formed but unknown here: a channel that does
// not exist, a subscription of another channel, a tap id no longer in use.
inline constexpr std::uint32_t error_not_found = 1168;
// flush timed out.
inline constexpr std::uint32_t error_timeout = 1460;
// The bus's delivery queue is full (max_queued_messages): the post is refused.
inline constexpr std::uint32_t error_not_enough_quota = 1816;
// The subscription already listens, or the bus is being destroyed.
inline constexpr std::uint32_t error_invalid_state = 5023;

// Longest name (channel, bus, blob field), in bytes, without the zero.
inline constexpr std::uint32_t max_name_length = 255;
// Most blob fields in one message.
inline constexpr std::uint32_t max_blob_fields = 1024;
// Most bytes of one message's blobs together, names included; larger
// messages are refused by set_blob, so every message can be encoded for the
// IPC library (parlo_ext.h).
inline constexpr std::uint64_t max_message_size = 16u << 20;
// Most messages waiting for delivery on one bus.
inline constexpr std::uint32_t max_queued_messages = 65536;

class bus;
class channel;
class subscription;
class message;

// Called on the bus's delivery thread for each message delivered to a
// subscription. `message` is the library's sealed copy, valid only during
// the call: read it, or copy() it to keep it (the copy is the callee's to
// release). Releasing the delivered message itself is refused.
typedef void (*message_callback)(parlo::message* message, void* context);

class message {
 public:
  // 0: a new message with the same id and blobs, unsealed, owned by the
  // caller (release it). Null when memory runs out.
  virtual message* copy() = 0;
  // 1: true after seal(), and for every message the library delivers.
  virtual bool is_sealed() = 0;
  // 2: number of blob fields.
  virtual std::uint32_t blob_count() = 0;
  // 3: name of the blob field at `index` (in the order of their first
  // set_blob), valid until the field is removed or the message released;
  // null past the end.
  virtual const char* blob_name(std::uint32_t index) = 0;
  // 4
  virtual std::uint32_t message_id() = 0;
  // 5: 0, or error_access_denied when sealed.
  virtual std::uint32_t set_message_id(std::uint32_t id) = 0;
  // 6: 0, error_not_found, error_invalid_parameter (null name) or
  // error_access_denied (sealed).
  virtual std::uint32_t remove_blob(const char* name) = 0;
  // 7: drops the id (0) and every blob. 0 or error_access_denied.
  virtual std::uint32_t clear() = 0;
  // 8: the size of encode()'s output.
  virtual std::uint64_t encoded_size() = 0;
  // 9: writes the message's wire form (siblings/parlo/message_codec.h) into
  // `buffer`; `written` receives its size. error_invalid_parameter for a
  // null argument or a capacity smaller than encoded_size().
  virtual std::uint32_t encode(void* buffer, std::uint64_t capacity, std::uint64_t* written) = 0;
  // 10-13
  virtual std::uint32_t reserved_10() = 0;
  virtual std::uint32_t reserved_11() = 0;
  virtual std::uint32_t reserved_12() = 0;
  virtual std::uint32_t reserved_13() = 0;
  // 14: the bytes of blob `name`, and their count in *size. A field that is
  // absent gives null and 0; a present empty field gives a non-null pointer
  // and 0. The bytes stay valid until the field is changed or removed, or
  // the message released. Null for a null argument.
  virtual const void* get_blob(const char* name, std::uint64_t* size) = 0;
  // 15: stores a copy of `size` bytes under `name`, replacing a field of
  // that name. `data` may be null only with size 0. 0, or
  // error_invalid_parameter (null name or data, bad name length, too many
  // fields, message over max_message_size), error_access_denied (sealed),
  // error_not_enough_memory. After a refusal (other than on a sealed
  // message) post refuses the message until clear().
  virtual std::uint32_t set_blob(const char* name, const void* data, std::uint64_t size) = 0;
  // 16-18
  virtual std::uint32_t reserved_16() = 0;
  virtual std::uint32_t reserved_17() = 0;
  virtual std::uint32_t reserved_18() = 0;
  // 19: makes the message read-only. Posting does not require it: post
  // always queues a sealed copy. Sealing twice is fine. Returns 0.
  virtual std::uint32_t seal() = 0;
  // 20-21
  virtual std::uint32_t reserved_20() = 0;
  virtual std::uint32_t reserved_21() = 0;
  // 22: frees a message the caller created (create_message, copy). For a
  // message the library is delivering it does nothing and returns
  // error_access_denied. The pointer is dead after a successful release.
  virtual std::uint32_t release() = 0;

 protected:
  ~message() = default;
};

class subscription {
 public:
  // 0: true between a successful listen and destroy_subscription.
  virtual bool is_listening() = 0;
  // 1: callbacks completed so far.
  virtual std::uint64_t delivered_count() = 0;
  // 2
  virtual std::uint32_t reserved_2() = 0;
  // 3: the channel this subscription was created on.
  virtual channel* get_subscription_channel() = 0;
  // 4: starts delivery: `callback(message, context)` is called on the
  // delivery thread for every message posted on the channel after listen
  // has returned. `flags` must be 0. 0, or error_invalid_parameter (null
  // callback, non-zero flags) or error_invalid_state (already listening, or
  // the bus is being destroyed).
  virtual std::uint32_t listen(message_callback callback, void* context, std::uint32_t flags) = 0;

 protected:
  ~subscription() = default;
};

class channel {
 public:
  // 0: the channel's name.
  virtual const char* name() = 0;
  // 1: queues a sealed copy of `message` for every subscription that
  // listens on this channel (and for the IPC library's taps, parlo_ext.h),
  // and returns. The message stays the caller's, unchanged; it may be
  // changed or released at once. 0, or error_invalid_parameter (null, or not
  // a live message of this library), error_invalid_data (a set_blob on the
  // message was refused: nothing is delivered rather than a message without
  // that blob), error_not_enough_quota (queue full), error_invalid_state
  // (bus being destroyed), error_not_enough_memory.
  virtual std::uint32_t post(message* message) = 0;
  // 2: the bus the channel belongs to.
  virtual bus* get_bus() = 0;
  // 3: subscriptions created on the channel and not yet destroyed.
  virtual std::uint32_t subscription_count() = 0;
  // 4
  virtual std::uint32_t reserved_4() = 0;
  // 5: a new subscription, which receives nothing until listen. Null when
  // memory runs out or the bus is being destroyed.
  virtual subscription* create_subscription() = 0;
  // 6: ends a subscription of this channel. When it returns, the
  // subscription's callback is not running and is never called again, and
  // the pointer is dead. Called from inside that subscription's own
  // callback it returns at once: the running call is the last one and the
  // object is freed when it returns. 0, or error_invalid_parameter (null),
  // error_not_found (not a live subscription of this channel; nothing is
  // touched).
  virtual std::uint32_t destroy_subscription(subscription* subscription) = 0;

 protected:
  ~channel() = default;
};

class bus {
 public:
  // 0: the name given to create_bus. Several buses may share a name; each is
  // independent.
  virtual const char* name() = 0;
  // 1: a new empty message (id 0, no blobs) owned by the caller, who
  // releases it. `kind` must be 0; null otherwise or when memory runs out.
  virtual message* create_message(std::uint32_t kind) = 0;
  // 2: creates channel `name`. Creating an existing name succeeds and keeps
  // the one channel. 0, or error_invalid_parameter (null, empty or too long
  // name), error_invalid_state (bus being destroyed), error_not_enough_memory.
  virtual std::uint32_t create_channel(const char* name) = 0;
  // 3: waits until every message posted on this bus before the call has been
  // delivered (callbacks and taps returned), at most `timeout_ms` (INFINITE:
  // no limit). 0, or error_timeout, error_possible_deadlock on the delivery
  // thread, error_invalid_state when the bus stopped before.
  virtual std::uint32_t flush(std::uint32_t timeout_ms) = 0;
  // 4: channel `name`, or null when it does not exist (or for a null name).
  virtual channel* get_channel(const char* name) = 0;
  // 5: number of channels.
  virtual std::uint32_t channel_count() = 0;

 protected:
  ~bus() = default;
};

// Exports, resolved by name.
//
// "create_bus": a new bus with its delivery thread; null for a null or bad
// name, or when the thread cannot start.
using create_bus_fn = bus* (*)(const char* name);
// "destroy_bus": stops the delivery thread and frees the bus, its channels,
// its subscriptions (no callback runs after it returns) and the messages
// still queued, which are not delivered. Messages the caller created stay
// the caller's. Null or already destroyed buses are ignored. Called from
// inside a callback of the same bus it returns at once; the bus is torn down
// when that callback returns, and the library then stays loaded for the rest
// of the process. A bus never destroyed keeps the library loaded.
using destroy_bus_fn = void (*)(bus* bus);

}  // namespace parlo
