#include <cstdlib>
#include <cstring>

#include "zepasdk/kv.h"

extern "C" {

PVLIBCSzList VLIBCSzListAlloc(int capacity) {
    if (capacity < 1) capacity = 1;
    PVLIBCSzList list = static_cast<PVLIBCSzList>(calloc(1, sizeof(VLIBCSzList)));
    if (list == nullptr) {
        VLIBCErrSet(ZEPA_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    list->pszItem = static_cast<char**>(calloc(static_cast<size_t>(capacity), sizeof(char*)));
    if (list->pszItem == nullptr) {
        free(list);
        VLIBCErrSet(ZEPA_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    list->nAlloc = capacity;
    list->nItem = 0;
    VLIBCErrSet(ZEPA_ERR_NONE);
    return list;
}

int VLIBCSzListPush(PVLIBCSzList* list, const char* item) {
    if (list == nullptr || *list == nullptr || item == nullptr) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    PVLIBCSzList l = *list;
    if (l->nItem >= l->nAlloc) {
        int grown = l->nAlloc * 2;
        char** items = static_cast<char**>(realloc(l->pszItem, static_cast<size_t>(grown) * sizeof(char*)));
        if (items == nullptr) {
            VLIBCErrSet(ZEPA_ERR_OUT_OF_MEMORY);
            return -1;
        }
        l->pszItem = items;
        l->nAlloc = grown;
    }
    char* copy = strdup(item);
    if (copy == nullptr) {
        VLIBCErrSet(ZEPA_ERR_OUT_OF_MEMORY);
        return -1;
    }
    l->pszItem[l->nItem++] = copy;
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

const char* VLIBCSzListGet(const VLIBCSzList* list, int index) {
    if (list == nullptr || index < 0 || index >= list->nItem) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return nullptr;
    }
    return list->pszItem[index];
}

void VLIBCSzListFree(PVLIBCSzList list) {
    if (list == nullptr) return;
    for (int i = 0; i < list->nItem; ++i) free(list->pszItem[i]);
    free(list->pszItem);
    free(list);
}

}  // extern "C"
