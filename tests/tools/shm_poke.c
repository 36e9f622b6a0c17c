/* Test helper for the qorbu-shm tests: puts a segment into states that the
 * library only reaches by accident.
 *   shm_poke busy NAME 0|1   write the header's busy word
 *   shm_poke empty NAME      create the object without sizing it, as a
 *                            creator that has not got far yet leaves it */
#define _GNU_SOURCE
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include "shm/shm.h"

static int set_busy(const char *object, uint32_t value)
{
    int fd = shm_open(object, O_RDWR, 0);
    if (fd < 0)
        return perror("shm_open"), 1;
    ShmHeader *header = mmap(NULL, (size_t)getpagesize(), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    close(fd);
    if (header == MAP_FAILED)
        return perror("mmap"), 1;
    header->busy = value;
    munmap(header, (size_t)getpagesize());
    return 0;
}

int main(int argc, char **argv)
{
    if (argc < 3)
        return fputs("usage: shm_poke busy NAME 0|1 | empty NAME\n", stderr), 2;
    char object[256];
    snprintf(object, sizeof object, "/%s", argv[2]);
    if (strcmp(argv[1], "busy") == 0 && argc == 4)
        return set_busy(object, (uint32_t)atoi(argv[3]));
    if (strcmp(argv[1], "empty") == 0) {
        int fd = shm_open(object, O_RDWR | O_CREAT | O_EXCL, 0660);
        return fd < 0 ? (perror("shm_open"), 1) : (close(fd), 0);
    }
    return fputs("shm_poke: unknown request\n", stderr), 2;
}
