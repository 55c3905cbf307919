// The bus as hosts see it, and the observer interfaces of its listeners.
#pragma once

#include <vorbel/iobservable.h>
#include <vorbel/qm_base.h>

#include <cstddef>
#include <cstdint>

// {43B918DC-4CC9-83D6-A040-1D12D54A1A9C}
inline constexpr GUID IID_ibus_base = {
    0x43B918DC, 0x4CC9, 0x83D6, {0xA0, 0x40, 0x1D, 0x12, 0xD5, 0x4A, 0x1A, 0x9C}};
// {A4E72244-5151-8154-2143-52164FEF7FD1}
inline constexpr GUID IID_ibus = {
    0xA4E72244, 0x5151, 0x8154, {0x21, 0x43, 0x52, 0x16, 0x4F, 0xEF, 0x7F, 0xD1}};
// {580B9BA1-8B25-B2EB-7044-83C2B13ABAAA}: what the bus asks each of its
// observers for before it calls it.
inline constexpr GUID IID_ibus_observer = {
    0x580B9BA1, 0x8B25, 0xB2EB, {0x70, 0x44, 0x83, 0xC2, 0xB1, 0x3A, 0xBA, 0xAA}};

// Element type of the bus's observer list. A bus calls an observer only
// through the ibus_observer that its GetInterface gives for IID_ibus_observer.
struct ibus_observer_base : IQmBaseInterface {};

// Listener notifications. They run on the bus's own notification thread, one
// at a time. The strings are valid only during the call. From inside a
// notification an observer may call the bus's listener operations and the
// registry (ivorbel) but must not add or remove observers of the same bus,
// nor give back the bus's last use.
struct ibus_observer : ibus_observer_base {
  // `pid` is the process in which the listener is registered.
  virtual void on_new_listener(std::uint32_t pid, const char* channel, const char* id) = 0;
  virtual void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) = 0;
};

struct ibus_base : IQmBaseInterface {};

// The longest channel name or listener id register_listener takes, in bytes
// without the terminating zero.
inline constexpr std::size_t ibus_max_listener_name = 65536;

// A named bus. Obtained from ivorbel::create_bus; valid until the matching
// destroy_bus. Listener names are narrow, zero-terminated UTF-8.
struct ibus : ibus_base, qm::iobservable<ibus_observer_base*> {
  // The messaging library's bus object, on which the host does its messaging.
  virtual void* get_messaging_bus() = 0;
  // 0; 87 for a null argument, a channel or id longer than
  // ibus_max_listener_name, or a listener that would make this process's
  // table too large to publish in one message of the messaging library (about
  // 16 MiB: the channel and id of each listener plus 32 bytes) or larger than
  // its peers take from one process (65,536 listeners); or 14
  // (ERROR_OUTOFMEMORY) when memory ran out. Registering the same pair twice
  // keeps two entries. Other processes learn of a registration shortly after
  // it returns (see the architecture notes).
  virtual std::uint32_t register_listener(const char* channel, const char* id) = 0;
  // Removes one entry equal to the pair. 0 (also when none was registered), 87
  // for a null argument, or 14 when memory ran out.
  virtual std::uint32_t unregister_listener(const char* channel, const char* id) = 0;
  // True when this process or any connected process has the listener (false,
  // with a line in the log, when memory ran out).
  virtual bool is_registered_listener(const char* channel, const char* id) = 0;

 protected:
  // The registry owns every bus; hosts never delete one.
  virtual ~ibus() = default;
};
