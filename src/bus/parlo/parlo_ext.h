// Additional exports of parlo.dll for the IPC library (parlo_ipc.dll), which
// joins channels of buses in different processes over named pipes, and a
// log hook.
//
// The IPC library gets the bus object from create_gateway and finds these
// exports in the parlo.dll already loaded into the process:
//
//   HMODULE parlo = GetModuleHandleW(L"parlo.dll");
//   auto tap = reinterpret_cast<parlo::ext::tap_fn>(GetProcAddress(parlo, "parlo_tap"));
//
// To join a local channel with a pipe it taps the channel: the tap receives
// every message posted locally on it, in its wire form (the byte layout of
// siblings/parlo/message_codec.h), and the library sends those bytes down the
// pipe. Bytes read from the pipe go to parlo_inject, which delivers them to
// the local subscriptions of the channel and to no tap, so a message that
// came from a pipe is never sent out again: no echo back to its sender, no
// relay to the other pipes of the channel. Every process therefore has to be
// joined directly to each process it wants to reach.
//
// Threads and order: a tap callback runs on the bus's delivery thread, the
// same thread as the bus's subscription callbacks, one call at a time. For
// one message, the taps of the channel are called (in the order they were
// added) before its local subscriptions. Per channel, taps see the local
// posts in the order the posts returned, and injected messages keep their
// place in that same order towards local subscriptions. Injected and posted
// messages share the bus's delivery queue (max_queued_messages).
//
// A tap callback, like a subscription callback, must return quickly: while it
// runs, nothing else of its bus is delivered. It should queue the bytes for
// its pipe writer and return. It may call parlo_untap (any tap, its own
// included), parlo_inject and every bus, channel and message operation except
// bus::flush.
#pragma once

#include <cstdint>

#include "parlo.h"

namespace parlo::ext {

// Receives one locally posted message of `channel` as `size` bytes of its
// wire form. `channel` and `bytes` are valid only during the call.
typedef void (*tap_callback)(const char* channel, const void* bytes, std::uint64_t size,
                             void* context);

// Receives the library's diagnostic lines: a level as the component's
// (4 error, 8 warning, 16 info), the function ("parlo::channel::post") and
// the text. Strings are valid only during the call.
typedef void (*log_callback)(std::uint32_t level, const char* function, const char* text,
                             void* context);

// Largest input parlo_inject considers: the wire form of the largest message.
inline constexpr std::uint64_t max_wire_size =
    12 + std::uint64_t{max_blob_fields} * 6 + max_message_size;

// "parlo_tap": calls `callback(channel, bytes, size, context)` for every
// message posted on channel `channel` of `bus` after parlo_tap has returned,
// until parlo_untap. A channel that does not exist yet is created, as by
// bus::create_channel, so the tap sees the channel's first post whoever
// creates it "again" later; a gateway can thus set up its taps before the
// component creates its channels. Several taps may share a channel; each sees
// every message. `*tap_id` receives an id that is unique for the bus's life
// (never 0, never reused).
// 0, or error_invalid_parameter (null argument, bad channel name, not a live
// bus of this library), error_invalid_state (bus being destroyed),
// error_not_enough_memory.
using tap_fn = std::uint32_t (*)(parlo::bus* bus, const char* channel, tap_callback callback,
                                 void* context, std::uint64_t* tap_id);

// "parlo_untap": removes tap `tap_id`. When it returns, the tap's callback is
// not running and is never called again. Called from inside that tap's own
// callback it returns at once; the running call is the last one.
// 0, or error_invalid_parameter (null or dead bus), error_not_found (no such
// tap: never added, or already removed).
using untap_fn = std::uint32_t (*)(parlo::bus* bus, std::uint64_t tap_id);

// "parlo_inject": decodes `size` bytes of wire form and queues the message for
// the subscriptions listening on channel `channel` of `bus` when the call
// is made; taps never see it. Returns once queued; the bytes stay the
// caller's. The channel must exist: bytes from a peer never create channels
// (a hostile peer could otherwise make any number of them).
// 0, or error_invalid_parameter (null argument, size over max_wire_size, dead
// bus), error_invalid_data (bytes that do not decode; nothing is delivered),
// error_not_found (no such channel), error_not_enough_quota (queue full),
// error_invalid_state (bus being destroyed), error_not_enough_memory.
using inject_fn = std::uint32_t (*)(parlo::bus* bus, const char* channel, const void* bytes,
                                    std::uint64_t size);

// "parlo_set_log": sends the library's diagnostic lines to `callback` (null:
// back to OutputDebugString). When it returns, the previous callback is not
// running and is not called again. The callback must not call back into the
// library.
using set_log_fn = void (*)(log_callback callback, void* context);

}  // namespace parlo::ext
