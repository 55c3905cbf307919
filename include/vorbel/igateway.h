// The gateway of a bus as hosts see it: connection notifications.
#pragma once

#include <vorbel/iobservable.h>
#include <vorbel/qm_base.h>

#include <cstdint>

// {7DDE8650-72D6-9DF7-AB43-22599B13B927}
inline constexpr GUID IID_igateway_base = {
    0x7DDE8650, 0x72D6, 0x9DF7, {0xAB, 0x43, 0x22, 0x59, 0x9B, 0x13, 0xB9, 0x27}};
// {A05E321E-C18B-8314-7145-C360D39E4475}
inline constexpr GUID IID_igateway = {
    0xA05E321E, 0xC18B, 0x8314, {0x71, 0x45, 0xC3, 0x60, 0xD3, 0x9E, 0x44, 0x75}};
// {AAF6F4AE-AD74-A95D-2D46-D105783F9174}
inline constexpr GUID IID_igateway_observer_base = {
    0xAAF6F4AE, 0xAD74, 0xA95D, {0x2D, 0x46, 0xD1, 0x05, 0x78, 0x3F, 0x91, 0x74}};
// {21EAC4B9-C504-AB5E-6244-D09C97F03EB1}: what the gateway asks each of its
// observers for before it calls it.
inline constexpr GUID IID_igateway_observer = {
    0x21EAC4B9, 0xC504, 0xAB5E, {0x62, 0x44, 0xD0, 0x9C, 0x97, 0xF0, 0x3E, 0xB1}};

// Element type of the gateway's observer list.
struct igateway_observer_base : IQmBaseInterface {};

// Connection notifications, called on the gateway's own notification thread,
// one at a time, in the order the pipe events happened. `name` is never
// null. For on_listen it is the name the IPC library gave with the event
// (empty when it gave none); for the other events it is the pipe's name as
// read from its handle (a backslash and the pipe's own name; empty when
// unknown). "local" events are about pipes this process serves, "remote"
// events about pipes it opened to other processes.
struct igateway_observer : igateway_observer_base {
  virtual void on_listen(const char* name) = 0;
  virtual void on_local_connect(const char* name, std::uint32_t pid) = 0;
  virtual void on_local_disconnect(const char* name, std::uint32_t pid) = 0;
  virtual void on_local_start_communication(const char* name, std::uint32_t pid) = 0;
  virtual void on_local_error(const char* name, std::uint32_t pid, std::uint32_t err) = 0;
  virtual void on_remote_connect(const char* name, std::uint32_t pid) = 0;
  virtual void on_remote_disconnect(const char* name, std::uint32_t pid) = 0;
  virtual void on_remote_start_communication(const char* name, std::uint32_t pid) = 0;
  virtual void on_remote_error(const char* name, std::uint32_t pid, std::uint32_t err) = 0;
};

struct igateway_base : IQmBaseInterface {};

// Reached with ivorbel::get_gateway. Its second face, for add_observer and
// remove_observer, is the qm::iobservable base.
struct igateway : igateway_base, qm::iobservable<igateway_observer_base*> {};
