/* Test helper for the qorbu-shm tests: puts a segment into states that the
 * library only reaches by accident.
 *   shm_poke busy NAME 0|1   write the header's busy word
 *   shm_poke empty NAME      create the object without sizing it, as a
 *                            creator that has not got far yet leaves it
 *   shm_poke sized NAME N    create it N bytes long and never publish it, as
 *                            a creator that died while initialising leaves it
 *   shm_poke loop NAME       link the first block of the lowest non-empty
 *                            free list to itself */
#define _GNU_SOURCE
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include "shm/shm.h"

static ShmHeader *map_segment(const char *object, size_t *length) {
    int fd = shm_open(object, O_RDWR, 0);
    if (fd < 0) return perror("shm_open"), NULL;
    struct stat st;
    *length = fstat(fd, &st) == 0 ? (size_t)st.st_size : 0;
    ShmHeader *header = mmap(NULL, *length, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    close(fd);
    return header == MAP_FAILED ? (perror("mmap"), NULL) : header;
}

static int set_busy(const char *object, uint32_t value) {
    size_t length;
    ShmHeader *header = map_segment(object, &length);
    if (!header) return 1;
    header->busy = value;
    munmap(header, length);
    return 0;
}

/* The poke maps the segment elsewhere: addresses are turned into offsets. */
static int link_to_itself(const char *object) {
    size_t length;
    ShmHeader *header = map_segment(object, &length);
    if (!header) return 1;
    for (int k = 0; k < 27; ++k) {
        if (header->freeList[k] != 0) {
            *(uintptr_t *)((char *)header + (header->freeList[k] - header->base)) = header->freeList[k];
            break;
        }
    }
    munmap(header, length);
    return 0;
}

int main(int argc, char **argv) {
    if (argc < 3)
        return fputs("usage: shm_poke busy NAME 0|1 | empty NAME | sized NAME N | loop NAME\n", stderr), 2;
    char object[256];
    snprintf(object, sizeof object, "/%s", argv[2]);
    if (strcmp(argv[1], "busy") == 0 && argc == 4) return set_busy(object, (uint32_t)atoi(argv[3]));
    if (strcmp(argv[1], "loop") == 0) return link_to_itself(object);
    if (strcmp(argv[1], "empty") == 0 || (strcmp(argv[1], "sized") == 0 && argc == 4)) {
        int fd = shm_open(object, O_RDWR | O_CREAT | O_EXCL, 0660);
        if (fd < 0) return perror("shm_open"), 1;
        int failed = argc == 4 && ftruncate(fd, atol(argv[3])) != 0;
        close(fd);
        return failed;
    }
    return fputs("shm_poke: unknown request\n", stderr), 2;
}
