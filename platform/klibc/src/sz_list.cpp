// KLIBSZLIST: a list of C strings kept in one block, the record followed by
// its array of item pointers. Growing reallocates the block, which is why
// the list may move and growing calls take the list's address.
#include "sz_list.h"
#include "error_state.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace zark::klibc {
namespace {

static_assert(sizeof(KLIBSZLIST) % alignof(char *) == 0,
              "the item array must be aligned right after the record");

std::size_t BlockSize(int32_t capacity) {
  return sizeof(KLIBSZLIST) +
         static_cast<std::size_t>(capacity) * sizeof(char *);
}

// The item array lives right after the record in the same block.
char **ItemsOf(KLIBSZLIST *list) {
  return reinterpret_cast<char **>(list + 1);
}

// Makes room for one more item, doubling the capacity up to the hard limit.
[[nodiscard]] bool ReserveOneMore(KLIBSZLIST **list) {
  KLIBSZLIST *current = *list;
  if (current->nItem < current->nAlloc) {
    return true;
  }
  if (current->nItem >= kSzListMaxItems) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_TOO_LARGE);
    return false;
  }
  const int32_t capacity =
      std::min(std::max(current->nAlloc, int32_t{1}) * 2, kSzListMaxItems);
  auto *moved =
      static_cast<KLIBSZLIST *>(std::realloc(current, BlockSize(capacity)));
  if (moved == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
    return false;
  }
  moved->nAlloc = capacity;
  moved->ppszItem = ItemsOf(moved);
  *list = moved;
  return true;
}

[[nodiscard]] bool IsIndexOf(const KLIBSZLIST *list, int i) {
  if (list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  if (i < 0 || i >= list->nItem) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_RANGE);
    return false;
  }
  return true;
}

} // namespace

int SzListPush(KLIBSZLIST **list, std::string_view text) {
  if (list == nullptr || *list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  auto *copy = static_cast<char *>(std::malloc(text.size() + 1));
  if (copy == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
    return -1;
  }
  if (!ReserveOneMore(list)) {
    std::free(copy);
    return -1;
  }
  std::memcpy(copy, text.data(), text.size());
  copy[text.size()] = '\0';
  KLIBSZLIST *current = *list;
  current->ppszItem[current->nItem] = copy;
  return current->nItem++;
}

void SzListTruncate(KLIBSZLIST *list, int32_t count) {
  if (list == nullptr) {
    return;
  }
  while (list->nItem > std::max(count, int32_t{0})) {
    --list->nItem;
    std::free(list->ppszItem[list->nItem]);
    list->ppszItem[list->nItem] = nullptr;
  }
}

} // namespace zark::klibc

using zark::klibc::kSzListMaxItems;

extern "C" {

KLIBSZLIST *KLIBCSzListAlloc(int capacity) {
  if (capacity < 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return nullptr;
  }
  if (capacity > kSzListMaxItems) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_TOO_LARGE);
    return nullptr;
  }
  const int32_t rooms = std::max(capacity, 1);
  auto *list =
      static_cast<KLIBSZLIST *>(std::malloc(zark::klibc::BlockSize(rooms)));
  if (list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
    return nullptr;
  }
  list->nItem = 0;
  list->nAlloc = rooms;
  list->ppszItem = zark::klibc::ItemsOf(list);
  return list;
}

void KLIBCSzListFree(KLIBSZLIST *list) {
  if (list == nullptr) {
    return;
  }
  zark::klibc::SzListTruncate(list, 0);
  std::free(list);
}

const char *KLIBCSzListGet(const KLIBSZLIST *list, int i) {
  if (!zark::klibc::IsIndexOf(list, i)) {
    return nullptr;
  }
  return list->ppszItem[i];
}

int KLIBCSzListRemove(KLIBSZLIST *list, int i) {
  if (!zark::klibc::IsIndexOf(list, i)) {
    return -1;
  }
  std::free(list->ppszItem[i]);
  char **items = list->ppszItem;
  std::memmove(items + i, items + i + 1,
               static_cast<std::size_t>(list->nItem - i - 1) * sizeof(char *));
  --list->nItem;
  items[list->nItem] = nullptr;
  return 0;
}

int KLIBCSzListRemoveAll(KLIBSZLIST *list) {
  if (list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  zark::klibc::SzListTruncate(list, 0);
  return 0;
}

int KLIBCSzListPush(KLIBSZLIST **list, const char *text) {
  if (text == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  return zark::klibc::SzListPush(list, text);
}

int KLIBCSzListFind(const KLIBSZLIST *list, const char *text) {
  if (list == nullptr || text == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  for (int32_t i = 0; i < list->nItem; ++i) {
    if (std::strcmp(list->ppszItem[i], text) == 0) {
      return i;
    }
  }
  return -1;
}

int KLIBCSzListSortItems(KLIBSZLIST *list, int ascending) {
  if (list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  return zark::klibc::GuardCBoundary(-1, [&] {
    char **first = list->ppszItem;
    char **last = first + list->nItem;
    // std::stable_sort falls back to an in-place merge when it cannot get a
    // buffer, so it does not fail for want of memory.
    if (ascending != 0) {
      std::stable_sort(first, last, [](const char *a, const char *b) {
        return std::strcmp(a, b) < 0;
      });
    } else {
      std::stable_sort(first, last, [](const char *a, const char *b) {
        return std::strcmp(a, b) > 0;
      });
    }
    return 0;
  });
}

} // extern "C"
