// The platform's list of strings.
#ifndef KAVO_STRING_LIST_H_
#define KAVO_STRING_LIST_H_

#ifdef __cplusplus
extern "C" {
#endif

// For one thread at a time; whoever made it releases it.
typedef struct KLIBC_SZ_LIST {
  int nItem;        // How many strings the list holds.
  char** ppszItem;  // Owned by the list.
  int nRoom;        // How many it can hold before it grows.
} KLIBCSZLIST;

// An empty list with room for about `bytes` bytes of text; null when memory is short. Released with
// KLIBCSzListFree.
KLIBCSZLIST* KLIBCSzListAlloc(int bytes);

// Appends a copy of `text`. The list may move, hence the pointer to it. The new number of strings;
// negative when memory is short, and the list is as it was.
int KLIBCSzListPush(KLIBCSZLIST** list, const char* text);

// The string at `index`, owned by the list and valid until it changes; null outside the list.
const char* KLIBCSzListGet(const KLIBCSZLIST* list, int index);

// Releases a list; null is taken.
void KLIBCSzListFree(KLIBCSZLIST* list);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_STRING_LIST_H_
