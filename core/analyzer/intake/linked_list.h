#pragma once

// A singly linked list of payload pointers whose head also remembers the last element, so that
// appending takes constant time. The analyzer uses it for file and row lists.
//
// Elements are allocated by addLLElement and freed by freeLL; the holder of the head owns the
// elements and, when it frees them with freePayloads, the payloads (heap objects of type T).
// Not thread-safe: a list belongs to one thread.

#include <new>

#include "core/runtime/clog.h"

template <typename T>
struct LL_ELEMENT {
  T* payload = nullptr;
  LL_ELEMENT* next = nullptr;
  LL_ELEMENT* last = nullptr;  // in the head only: the last element
};

// Appends payload to *list (null for an empty list). False, with a trace, when no element could
// be allocated; the payload then stays the caller's.
template <typename T>
bool addLLElement(LL_ELEMENT<T>** list, T* payload) {
  LL_ELEMENT<T>* element = new (std::nothrow) LL_ELEMENT<T>;
  if (element == nullptr) {
    CLOG::min("%s failed to \"new\" a LL element", "CAnalyzer::addLLElement");
    return false;
  }
  element->payload = payload;
  if (*list == nullptr) {
    element->last = element;
    *list = element;
  } else {
    (*list)->last->next = element;
    (*list)->last = element;
  }
  return true;
}

// Frees every element, and with freePayloads every payload too; *list becomes null.
template <typename T>
void freeLL(LL_ELEMENT<T>** list, bool freePayloads) {
  for (LL_ELEMENT<T>* e = *list; e != nullptr;) {
    LL_ELEMENT<T>* const next = e->next;
    if (freePayloads) {
      delete e->payload;
    }
    delete e;
    e = next;
  }
  *list = nullptr;
}

template <typename T>
void freeLL(LL_ELEMENT<T>** list) {
  freeLL(list, false);
}

template <typename T>
int getLLCount(const LL_ELEMENT<T>* list) {
  int count = 0;
  for (; list != nullptr; list = list->next) {
    ++count;
  }
  return count;
}
