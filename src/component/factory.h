// Registry of component factories behind the three exports.
//
// Factories form an intrusive singly linked list that static initialisation
// fills before any export can be called; the head is the factory registered
// last. Each factory keeps at most one instance of its object per process,
// counted by use. Any host thread may call in; creation and destruction
// serialise on the factory's critical section, GetInterface takes no lock.
#pragma once

#include <windows.h>

#include <cstdint>
#include <cwchar>

#include <vorbel/qm_base.h>

#include "logging/logger.h"

// Holds a critical section for its scope, also when an exception leaves it.
class critical_section_guard {
 public:
  explicit critical_section_guard(CRITICAL_SECTION& section) : section_(section) {
    ::EnterCriticalSection(&section_);
  }
  critical_section_guard(const critical_section_guard&) = delete;
  critical_section_guard& operator=(const critical_section_guard&) = delete;
  ~critical_section_guard() { ::LeaveCriticalSection(&section_); }

 private:
  CRITICAL_SECTION& section_;
};

class qmFactoryBase {
 public:
  qmFactoryBase(const qmFactoryBase&) = delete;
  qmFactoryBase& operator=(const qmFactoryBase&) = delete;

  // The factory registered last, or null.
  static qmFactoryBase* head();

  virtual ~qmFactoryBase();
  virtual void* GetInterface(GUID iid) = 0;
  virtual std::uint32_t CreateObject(const wchar_t* name, GUID iid, void** out) = 0;
  virtual void DestroyObject(const wchar_t* name, void* object) = 0;

 protected:
  // Links this factory in front of the list.
  qmFactoryBase();

  qmFactoryBase* next;
};

template <typename T>
class qmFactory final : public qmFactoryBase {
 public:
  // `alias` may be empty; an empty alias never matches.
  explicit qmFactory(const wchar_t* object_name, const wchar_t* object_alias = L"") {
    copy_name(name, object_name);
    copy_name(alias, object_alias);
    ::InitializeCriticalSection(&lock);
  }
  // Does not destroy a live instance: the library is being unloaded.
  ~qmFactory() override { ::DeleteCriticalSection(&lock); }

  std::uint32_t CreateObject(const wchar_t* object_name, GUID iid, void** out) override {
    if (out == nullptr) return ERROR_INVALID_DATA;
    *out = nullptr;
    if (object_name == nullptr) return ERROR_INVALID_DATA;
    // Any other identifier is refused before the name is looked at, even for a
    // name a later factory owns.
    if (!qm::same_iid(iid, IID_IQmCreateAlternate) && !qm::same_iid(iid, IID_IQmBaseInterface)) {
      return ERROR_INVALID_DATA;
    }
    if (!matches(object_name)) {
      return next == nullptr ? ERROR_NOT_FOUND : next->CreateObject(object_name, iid, out);
    }
    critical_section_guard guard(lock);
    if (count == 0) {
      // Without an instance nothing is counted: the caller, told 14, gives
      // nothing back for it.
      try {
        instance = new T();
      } catch (...) {
        logging::log_current_exception(L"qmFactory::CreateObject");
        return ERROR_OUTOFMEMORY;
      }
    }
    if (instance != nullptr) *out = instance->GetInterface(iid);
    // Counted even when no interface came out: the caller still pairs it with
    // a QmDestroyObject.
    ++count;
    return *out != nullptr ? ERROR_SUCCESS : ERROR_OUTOFMEMORY;
  }

  void DestroyObject(const wchar_t* object_name, void* object) override {
    if (object == nullptr || object_name == nullptr || !matches(object_name)) {
      if (next != nullptr) next->DestroyObject(object_name, object);
      return;
    }
    critical_section_guard guard(lock);
    // An unpaired destroy must not drive the count below zero, or the next
    // creation would find a non-zero count and hand out no instance.
    if (count > 0 && --count == 0) {
      delete instance;
      instance = nullptr;
    }
  }

  void* GetInterface(GUID iid) override {
    if (instance != nullptr) {
      if (void* face = instance->GetInterface(iid)) return face;
    }
    return next != nullptr ? next->GetInterface(iid) : nullptr;
  }

  // For tests: the current use count.
  std::int32_t use_count() const { return count; }

 private:
  static void copy_name(wchar_t (&dst)[1024], const wchar_t* src) {
    std::size_t i = 0;
    for (; src != nullptr && i + 1 < 1024 && src[i] != L'\0'; ++i) dst[i] = src[i];
    dst[i] = L'\0';
  }

  bool matches(const wchar_t* object_name) const {
    if (std::wcscmp(object_name, name) == 0) return true;
    return alias[0] != L'\0' && std::wcscmp(object_name, alias) == 0;
  }

  CRITICAL_SECTION lock{};
  T* instance = nullptr;
  std::int32_t count = 0;
  wchar_t name[1024] = {};
  wchar_t alias[1024] = {};
};

class vorbel_impl;
// The one factory this library registers, under "vorbel".
qmFactory<vorbel_impl>& vorbel_factory();
