#include "kavo/string_list.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "platform/local/boundary.h"

using kavo::local::Fail;

namespace {

constexpr int kTypicalBytes = 16;  // Of one string.
constexpr int kLeastRoom = 8;

}  // namespace

KLIBCSZLIST* KLIBCSzListAlloc(int bytes) {
  const int room = std::max(bytes / kTypicalBytes, kLeastRoom);
  auto* const list = static_cast<KLIBCSZLIST*>(malloc(sizeof(KLIBCSZLIST)));
  auto** const items = static_cast<char**>(malloc(sizeof(char*) * static_cast<size_t>(room)));
  if (list == nullptr || items == nullptr) {
    free(list);
    free(items);
    Fail(KAVO_ERR_SYSTEM, ENOMEM);
    return nullptr;
  }
  *list = {0, items, room};
  return list;
}

int KLIBCSzListPush(KLIBCSZLIST** list, const char* text) {
  if (list == nullptr || *list == nullptr || text == nullptr) {
    return Fail(KAVO_ERR_BAD_PARAMETER, EINVAL);
  }
  KLIBCSZLIST& into = **list;
  if (into.nItem >= into.nRoom) {
    if (into.nItem > INT_MAX / 2) {
      return Fail(KAVO_ERR_SYSTEM, ENOMEM);
    }
    const int room = std::max(2 * into.nItem, kLeastRoom);
    void* const items = realloc(into.ppszItem, sizeof(char*) * static_cast<size_t>(room));
    if (items == nullptr) {
      return Fail(KAVO_ERR_SYSTEM, ENOMEM);
    }
    into.ppszItem = static_cast<char**>(items);
    into.nRoom = room;
  }
  char* const copy = strdup(text);
  if (copy == nullptr) {
    return Fail(KAVO_ERR_SYSTEM, ENOMEM);
  }
  into.ppszItem[into.nItem] = copy;
  return ++into.nItem;
}

const char* KLIBCSzListGet(const KLIBCSZLIST* list, int index) {
  return list == nullptr || index < 0 || index >= list->nItem ? nullptr : list->ppszItem[index];
}

void KLIBCSzListFree(KLIBCSZLIST* list) {
  if (list != nullptr) {
    std::for_each(list->ppszItem, list->ppszItem + list->nItem, free);
    free(list->ppszItem);
    free(list);
  }
}
