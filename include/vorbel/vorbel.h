// Everything a host compiles against: the interfaces and the three exports of
// vorbel.dll.
#pragma once

#include <vorbel/ibus.h>
#include <vorbel/ibus_configuration.h>
#include <vorbel/igateway.h>
#include <vorbel/igateway_admission.h>
#include <vorbel/iobservable.h>
#include <vorbel/ivorbel.h>
#include <vorbel/qm_base.h>

#include <cstdint>

// The object name the registry is created under.
#define VORBEL_OBJECT_NAME L"vorbel"

// Exports of vorbel.dll, by their undecorated names.
extern "C" {
typedef std::uint32_t (*QmCreateObject_fn)(const wchar_t* name, const GUID& iid, void** out);
typedef void (*QmDestroyObject_fn)(const wchar_t* name, void* object);
typedef void* (*QmGetInterface_fn)(const GUID& iid);
}
