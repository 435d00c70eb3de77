// The intrusive, optionally locked, doubly linked list under every collection
// of the run-time. Orientation: olHead -> olePrev -> ... -> olTail and
// olTail -> oleNext -> ... -> olHead.
#pragma once

#include <cstdint>
#include <cstring>

class OrdList;

// Header at the start of every object that can be put on a list.
struct OrdListElement {
  char eyeCatcher[16];
  uint64_t size;
  OrdList* oleAnchor;        // list the element is on; null when on none
  OrdListElement* olePrev;   // neighbour on the tail side; null for the tail
  OrdListElement* oleNext;   // neighbour on the head side; null for the head
  int32_t withdrawn;         // non-zero: browse operations pass over it
  void* object;

  OrdListElement() { initElement("KlpOLE:"); }
  void initElement(const char* eye) {
    memset(this, 0, sizeof(OrdListElement));
    strncpy(eyeCatcher, eye, sizeof(eyeCatcher) - 1);
    size = 64;
  }
};
