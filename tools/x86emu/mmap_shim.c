/*
 * mmap_shim.c: gives MAP_FIXED_NOREPLACE its real meaning in 32-bit
 * processes that run under qemu-i386 user-mode emulation.
 *
 * Wine's ntdll reserves the address space at start-up with
 * mmap(MAP_FIXED_NOREPLACE). qemu 7.2 treats that flag as a mere hint and
 * returns some other address; ntdll then takes the range as taken and
 * bisects it down to 64 KiB, which costs tens of thousands of mmap/munmap
 * pairs and close to a minute per process. Preloaded (LD_PRELOAD), this
 * library answers such calls itself: when the requested range is free in
 * /proc/self/maps (which qemu reports as the guest sees it) it maps it with
 * MAP_FIXED, otherwise it fails with EEXIST, as the kernel would. Every
 * other call goes straight to the mmap2 system call, as glibc's mmap does.
 *
 * Built without a C library (gcc -m32 -nostdlib -ffreestanding -fPIC
 * -shared); the one libc symbol used, __errno_location, is bound at load
 * time from the process's own libc. A concurrent mmap from another thread
 * between the check and the MAP_FIXED call could be overwritten; callers of
 * MAP_FIXED_NOREPLACE in Wine hold its virtual memory lock, and the window
 * is a few microseconds.
 */

#define MAP_FIXED 0x10
#define MAP_FIXED_NOREPLACE 0x100000
#define MAP_FAILED ((void *)-1)
#define EEXIST 17
#define EINVAL 22
#define PAGE 4096ULL

#define SYS_read 3
#define SYS_open 5
#define SYS_close 6
#define SYS_mmap2 192
#define O_RDONLY 0

typedef unsigned int size_t;

extern int *__errno_location(void);

/* Raw i386 system calls (int $0x80). The six-argument form passes the last
 * argument in %ebp, which cannot be named as an operand: push it, load it,
 * and restore %ebp afterwards. */
static long sys3(long n, long a, long b, long c)
{
    long r;
    __asm__ volatile("int $0x80" : "=a"(r) : "a"(n), "b"(a), "c"(b), "d"(c) : "memory");
    return r;
}

static long sys6(long n, long a, long b, long c, long d, long e, long f)
{
    long r;
    __asm__ volatile("pushl %7\n\t"
                     "push %%ebp\n\t"
                     "mov 4(%%esp), %%ebp\n\t"
                     "int $0x80\n\t"
                     "pop %%ebp\n\t"
                     "add $4, %%esp"
                     : "=a"(r)
                     : "a"(n), "b"(a), "c"(b), "d"(c), "S"(d), "D"(e), "g"(f)
                     : "memory");
    return r;
}

/* A negative result between -4095 and -1 is an error number. */
static void *mmap_result(long r)
{
    if ((unsigned long)r > -4096UL) {
        *__errno_location() = (int)-r;
        return MAP_FAILED;
    }
    return (void *)r;
}

/* Returns 1 when [start, end) overlaps no mapping listed in
 * /proc/self/maps, 0 when it does, -1 when the file cannot be read. Each
 * line begins "start-end " in hexadecimal; the rest of it is skipped. */
static int range_is_free(unsigned long long start, unsigned long long end)
{
    char buf[1024];
    unsigned long long lo = 0, hi = 0;
    int field = 0; /* 0: start address, 1: end address, 2: rest of line */
    long fd = sys3(SYS_open, (long)"/proc/self/maps", O_RDONLY, 0);
    if (fd < 0) return -1;
    for (;;) {
        long n = sys3(SYS_read, fd, (long)buf, sizeof buf);
        if (n < 0) {
            sys3(SYS_close, fd, 0, 0);
            return -1;
        }
        if (n == 0) break;
        for (long i = 0; i < n; i++) {
            char ch = buf[i];
            int digit = ch >= '0' && ch <= '9' ? ch - '0'
                      : ch >= 'a' && ch <= 'f' ? ch - 'a' + 10
                      : -1;
            if (ch == '\n') {
                field = 0;
                lo = hi = 0;
            } else if (field == 0) {
                if (digit >= 0) lo = lo * 16 + digit;
                else field = 1; /* the '-' */
            } else if (field == 1) {
                if (digit >= 0) {
                    hi = hi * 16 + digit;
                } else {
                    field = 2;
                    if (lo < end && hi > start) {
                        sys3(SYS_close, fd, 0, 0);
                        return 0;
                    }
                }
            }
        }
    }
    sys3(SYS_close, fd, 0, 0);
    return 1;
}

/* Serialises the check-and-map of concurrent MAP_FIXED_NOREPLACE calls. */
static volatile int lock;

static void *map_noreplace(void *addr, size_t len, int prot, int flags, int fd,
                           unsigned long long off)
{
    unsigned long long start = (unsigned long)addr;
    unsigned long long end = start + ((len + PAGE - 1) & ~(PAGE - 1));
    int free;
    void *p;

    flags &= ~MAP_FIXED_NOREPLACE;
    if (len == 0 || (start & (PAGE - 1)) || (off & (PAGE - 1))) {
        *__errno_location() = EINVAL;
        return MAP_FAILED;
    }
    while (__sync_lock_test_and_set(&lock, 1))
        ;
    free = range_is_free(start, end);
    if (free == 0) {
        __sync_lock_release(&lock);
        *__errno_location() = EEXIST;
        return MAP_FAILED;
    }
    /* When the maps cannot be read, fall back to what the system does with
     * the flag (a hint at worst); the caller checks the address it gets. */
    p = mmap_result(sys6(SYS_mmap2, (long)addr, len, prot,
                         free == 1 ? flags | MAP_FIXED : flags, fd, (long)(off / PAGE)));
    __sync_lock_release(&lock);
    return p;
}

void *mmap64(void *addr, size_t len, int prot, int flags, int fd, long long off)
{
    if (flags & MAP_FIXED_NOREPLACE)
        return map_noreplace(addr, len, prot, flags, fd, (unsigned long long)off);
    /* mmap2 takes the offset in 4096-byte pages. */
    if ((off & (PAGE - 1)) || off < 0 || (unsigned long long)off / PAGE > 0xffffffffULL) {
        *__errno_location() = EINVAL;
        return MAP_FAILED;
    }
    return mmap_result(sys6(SYS_mmap2, (long)addr, len, prot, flags, fd, (long)(off / PAGE)));
}

void *mmap(void *addr, size_t len, int prot, int flags, int fd, long off)
{
    /* The 32-bit off_t is signed; a negative one is invalid, as in glibc. */
    return mmap64(addr, len, prot, flags, fd, off);
}
