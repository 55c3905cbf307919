// The three exports of vorbel.dll and the registration of its one factory.
#include <vorbel/vorbel.h>

#include "component/factory.h"
#include "registry/vorbel_impl.h"

qmFactory<vorbel_impl>& vorbel_factory() {
  static qmFactory<vorbel_impl> factory(VORBEL_OBJECT_NAME);
  return factory;
}

namespace {
// Registers the factory during static initialisation, before any export runs.
const bool g_registered = (vorbel_factory(), true);
}  // namespace

extern "C" {

std::uint32_t QmCreateObject(const wchar_t* name, const GUID& iid, void** out) {
  qmFactoryBase* head = qmFactoryBase::head();
  if (head == nullptr) return ERROR_NOT_FOUND;
  return head->CreateObject(name, iid, out);
}

void QmDestroyObject(const wchar_t* name, void* object) {
  if (qmFactoryBase* head = qmFactoryBase::head()) head->DestroyObject(name, object);
}

void* QmGetInterface(const GUID& iid) {
  qmFactoryBase* head = qmFactoryBase::head();
  return head != nullptr ? head->GetInterface(iid) : nullptr;
}

}  // extern "C"
