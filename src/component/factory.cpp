#include "component/factory.h"

namespace {
qmFactoryBase* g_head = nullptr;
}  // namespace

qmFactoryBase* qmFactoryBase::head() { return g_head; }

qmFactoryBase::qmFactoryBase() : next(g_head) { g_head = this; }

qmFactoryBase::~qmFactoryBase() {
  if (g_head == this) {
    g_head = next;
    return;
  }
  for (qmFactoryBase* node = g_head; node != nullptr; node = node->next) {
    if (node->next == this) {
      node->next = next;
      return;
    }
  }
}
