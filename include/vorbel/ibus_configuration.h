// The configuration provider a host hands to ivorbel::create_bus.
#pragma once

#include <vorbel/qm_base.h>

#include <cstdint>

// Implemented and owned by the host; called only on the thread of the
// create_bus call that received it, and only during that call.
//
// The three enumerations are driven by a cursor that the component sets to 0
// before the first call and then passes back unchanged; the provider reads and
// advances it. A call that returns true delivered one element; false ends the
// enumeration. Strings stay the provider's and must live until its next call.
// Before enumerating exported or imported channels the component sets
// *link_type to 3 and *security to 0 and does not reset them between calls.
struct ibus_configuration : IQmBaseInterface {
  // The bus becomes the process's default bus (unless one is already set).
  virtual bool is_default_bus() = 0;
  // A channel the bus creates locally.
  virtual bool next_local_channel(std::uint64_t* cursor, const char** channel_name) = 0;
  // A local channel offered to other processes on the named pipe `pipe_name`.
  // `security` 0 admits only peers signed by this process's signer, 1 also
  // other validly signed peers.
  virtual bool next_exported_channel(std::uint64_t* cursor, const char** channel_name,
                                     const char** pipe_name, std::uint32_t* link_type,
                                     std::uint32_t* security) = 0;
  // Channel `remote_channel_name` of bus `remote_bus_name` in another process,
  // reached over `pipe_name` and joined to the local `channel_name`.
  virtual bool next_imported_channel(std::uint64_t* cursor, const char** channel_name,
                                     const char** pipe_name, std::uint32_t* link_type,
                                     std::uint32_t* security, const char** remote_channel_name,
                                     const char** remote_bus_name) = 0;
};

// {5C6B2A1E-7F3D-4E0A-9B84-2D61C0F7A935}: an optional face of the
// configuration provider, asked for with the provider's GetInterface while a
// bus's gateway is built. A provider that answers null keeps the defaults.
inline constexpr GUID IID_ibus_trust_policy = {
    0x5C6B2A1E, 0x7F3D, 0x4E0A, {0x9B, 0x84, 0x2D, 0x61, 0xC0, 0xF7, 0xA9, 0x35}};

// How far the bus's gateway trusts a peer beyond its code signature.
struct ibus_trust_policy : IQmBaseInterface {
  // True: a peer (a client of our pipes, or a server we join) is admitted
  // only when the user it runs as can neither remove nor rename its image
  // file or any folder on the image's path, nor change their permissions, nor
  // write the image; so that nobody of that user can swap the file that was
  // verified for another. Images installed under a folder that only
  // administrators may change pass; an image in the user's own folders does
  // not. Default false.
  virtual bool protected_image_paths_only() = 0;
};
