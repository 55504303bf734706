/*
 * mmap_shim.c: makes 32-bit Wine usable under qemu-i386 user-mode
 * emulation. Preloaded (LD_PRELOAD) into the 32-bit Wine loader only; it
 * fixes two places where qemu 7.2 differs from a real kernel.
 *
 * 1. MAP_FIXED_NOREPLACE. Wine's ntdll reserves the address space at
 *    start-up with mmap(MAP_FIXED_NOREPLACE). qemu treats the flag as a
 *    mere hint and returns some other address; ntdll then takes the range
 *    as taken and bisects it down to 64 KiB, which costs tens of thousands
 *    of mmap/munmap pairs and close to a minute per process. mmap() and
 *    mmap64() here answer such calls themselves: when the range is free in
 *    /proc/self/maps (which qemu reports as the guest sees it) they map it
 *    with MAP_FIXED, otherwise they fail with EEXIST, as the kernel would.
 *    Every other call goes straight to the mmap2 system call, as in glibc.
 *
 * 2. Thread-local segments. qemu keeps a single descriptor table for the
 *    whole process, so the thread-local entry that glibc (%gs) and Wine
 *    (%fs, the TEB) set up with set_thread_area is shared by all threads:
 *    each new thread overwrites it with its own base. Whenever a thread
 *    reloads the segment register later (qemu's sigreturn does, and Wine's
 *    signal handlers and exception dispatch do), it gets the newest
 *    thread's base and runs with another thread's TLS or TEB: "stack
 *    smashing detected", "wine client error", crashes in exceptions. The
 *    fix gives every thread a private entry in the LDT, which qemu
 *    emulates faithfully:
 *    - syscall(SYS_set_thread_area) is refused, so Wine falls back to
 *      a per-thread LDT entry for %fs (its own code path for kernels that
 *      lack set_thread_area);
 *    - each thread's %gs is moved to a private LDT entry with the same
 *      base: the main thread in the constructor, every other thread at its
 *      start (pthread_create below starts them through a trampoline).
 *      glibc's clone needs the creator's %gs to be its original GDT
 *      selector, so pthread_create switches back to it for the call, with
 *      signals blocked and the shared entry rewritten to its own base.
 *
 * Built without a C library (gcc -m32 -nostdlib -ffreestanding -fPIC
 * -shared); the few libc functions used are bound at load time from the
 * process's own libc. System calls go through int $0x80.
 */

typedef unsigned int size_t;

#define MAP_FIXED 0x10
#define MAP_FIXED_NOREPLACE 0x100000
#define MAP_FAILED ((void *)-1)
#define EEXIST 17
#define EINVAL 22
#define ENOSYS 38
#define ESRCH 3
#define PAGE 4096ULL

#define SYS_read 3
#define SYS_open 5
#define SYS_close 6
#define SYS_getpid 20
#define SYS_modify_ldt 123
#define SYS_rt_sigprocmask 175
#define SYS_mmap2 192
#define SYS_gettid 224
#define SYS_set_thread_area 243
#define SYS_tgkill 270

#define O_RDONLY 0
#define O_CLOEXEC 0x80000
#define RTLD_NEXT ((void *)-1)
#define SIG_SETMASK 2

extern int *__errno_location(void);
extern void *dlsym(void *handle, const char *name);
extern void *malloc(size_t size);
extern void free(void *p);

/* ---- raw system calls --------------------------------------------------- */

/* The sixth argument travels in %ebp, which cannot be named as an operand:
 * push it, load it, and restore %ebp afterwards. */
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

#define sys(n, a, b, c) sys6(n, (long)(a), (long)(b), (long)(c), 0, 0, 0)

/* A result between -4095 and -1 is an error number. */
static int is_error(long r) { return (unsigned long)r > -4096UL; }

static long set_errno(long r)
{
    if (!is_error(r)) return r;
    *__errno_location() = (int)-r;
    return -1;
}

/* ---- 1. MAP_FIXED_NOREPLACE --------------------------------------------- */

/* Returns 1 when [start, end) overlaps no mapping listed in
 * /proc/self/maps, 0 when it does, -1 when the file cannot be read. Each
 * line begins "start-end " in hexadecimal; the rest of it is skipped. */
static int range_is_free(unsigned long long start, unsigned long long end)
{
    char buf[1024];
    unsigned long long lo = 0, hi = 0;
    int field = 0; /* 0: start address, 1: end address, 2: rest of line */
    long fd = sys(SYS_open, "/proc/self/maps", O_RDONLY | O_CLOEXEC, 0);
    if (is_error(fd)) return -1;
    for (;;) {
        long n = sys(SYS_read, fd, buf, sizeof buf);
        if (is_error(n)) {
            sys(SYS_close, fd, 0, 0);
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
                        sys(SYS_close, fd, 0, 0);
                        return 0;
                    }
                }
            }
        }
    }
    sys(SYS_close, fd, 0, 0);
    return 1;
}

static volatile int map_lock; /* serialises concurrent check-and-map */

static void *map_noreplace(void *addr, size_t len, int prot, int flags, int fd,
                           unsigned long long off)
{
    unsigned long long start = (unsigned long)addr;
    unsigned long long end = start + ((len + PAGE - 1) & ~(PAGE - 1));
    int free_range;
    long r;

    flags &= ~MAP_FIXED_NOREPLACE;
    if (len == 0 || (start & (PAGE - 1)) || (off & (PAGE - 1)))
        return (void *)set_errno(-EINVAL);
    while (__sync_lock_test_and_set(&map_lock, 1))
        ;
    free_range = range_is_free(start, end);
    if (free_range == 0) {
        r = -EEXIST;
    } else {
        /* When the maps cannot be read, do what the system does with the
         * flag (a hint at worst); the caller checks the address it gets. */
        if (free_range == 1) flags |= MAP_FIXED;
        r = sys6(SYS_mmap2, (long)addr, len, prot, flags, fd, (long)(off / PAGE));
    }
    __sync_lock_release(&map_lock);
    return (void *)set_errno(r);
}

void *mmap64(void *addr, size_t len, int prot, int flags, int fd, long long off)
{
    if (flags & MAP_FIXED_NOREPLACE)
        return map_noreplace(addr, len, prot, flags, fd, (unsigned long long)off);
    /* mmap2 takes the offset in 4096-byte pages. */
    if ((off & (PAGE - 1)) || off < 0 || (unsigned long long)off / PAGE > 0xffffffffULL)
        return (void *)set_errno(-EINVAL);
    return (void *)set_errno(sys6(SYS_mmap2, (long)addr, len, prot, flags, fd, (long)(off / PAGE)));
}

void *mmap(void *addr, size_t len, int prot, int flags, int fd, long off)
{
    /* glibc reads a 32-bit offset as unsigned (files up to 4 GiB). */
    return mmap64(addr, len, prot, flags, fd, (unsigned long)off);
}

/* ---- 2. private thread-local segments ----------------------------------- */

/* The layout the kernel's modify_ldt and set_thread_area take. */
struct user_desc {
    unsigned int entry_number;
    unsigned int base_addr;
    unsigned int limit;
    unsigned int seg_32bit : 1, contents : 2, read_exec_only : 1, limit_in_pages : 1,
                 seg_not_present : 1, useable : 1;
};

/* LDT entries 1..511 hold the threads' %gs; Wine takes its own entries
 * from 512 up when it sees that %gs is an LDT selector. An entry is free
 * when its owner thread no longer exists. */
#define GS_SLOTS 512
static int slot_owner[GS_SLOTS];
static volatile int slot_lock;
static unsigned short gdt_gs;         /* glibc's original %gs selector */
static volatile int create_lock;      /* serialises pthread_create */

static unsigned short get_gs(void)
{
    unsigned short v;
    __asm__ volatile("movw %%gs, %0" : "=r"(v));
    return v;
}

static void set_gs(unsigned short v) { __asm__ volatile("movw %0, %%gs" ::"r"(v)); }

/* glibc's thread control block starts with a pointer to itself, so
 * %gs:0 is the base of the current thread's segment. */
static unsigned int gs_base(void)
{
    unsigned int v;
    __asm__ volatile("movl %%gs:0, %0" : "=r"(v));
    return v;
}

static void fill_desc(struct user_desc *d, unsigned int entry, unsigned int base)
{
    /* The same shape glibc gives its TLS segment: 4 GiB, 32-bit data. */
    d->entry_number = entry;
    d->base_addr = base;
    d->limit = 0xfffff;
    d->seg_32bit = 1;
    d->contents = 0;
    d->read_exec_only = 0;
    d->limit_in_pages = 1;
    d->seg_not_present = 0;
    d->useable = 1;
}

/* Moves the calling thread's %gs to a free LDT entry with the same base.
 * Leaves %gs alone when no entry can be had. */
static void use_private_gs(void)
{
    int tid = (int)sys(SYS_gettid, 0, 0, 0);
    int pid = (int)sys(SYS_getpid, 0, 0, 0);
    struct user_desc d;
    int slot;

    while (__sync_lock_test_and_set(&slot_lock, 1))
        ;
    for (slot = 1; slot < GS_SLOTS; slot++) {
        int owner = slot_owner[slot];
        if (owner == 0 || (owner != tid && sys(SYS_tgkill, pid, owner, 0) == -ESRCH))
            break;
    }
    if (slot < GS_SLOTS) slot_owner[slot] = tid;
    __sync_lock_release(&slot_lock);
    if (slot == GS_SLOTS) return;

    fill_desc(&d, slot, gs_base());
    if (is_error(sys(SYS_modify_ldt, 0x11, &d, sizeof d))) {
        slot_owner[slot] = 0;
        return;
    }
    set_gs((unsigned short)(slot << 3 | 7)); /* LDT, ring 3 */
}

__attribute__((constructor)) static void init(void)
{
    gdt_gs = get_gs();
    /* Only a GDT selector (glibc's TLS entry) needs moving. */
    if (gdt_gs && !(gdt_gs & 4)) use_private_gs();
}

/* Wine calls set_thread_area through syscall() to get one shared entry for
 * every thread's TEB; refusing it makes Wine use one LDT entry per thread.
 * Everything else passes through (up to six arguments, as in glibc). */
long syscall(long n, long a, long b, long c, long d, long e, long f)
{
    if (n == SYS_set_thread_area) return set_errno(-ENOSYS);
    return set_errno(sys6(n, a, b, c, d, e, f));
}

struct start {
    void *(*fn)(void *);
    void *arg;
    unsigned int mask[2]; /* the creator's signal mask */
};

static void *trampoline(void *p)
{
    struct start s = *(struct start *)p;
    free(p);
    use_private_gs();
    sys6(SYS_rt_sigprocmask, SIG_SETMASK, (long)s.mask, 0, 8, 0, 0);
    return s.fn(s.arg);
}

typedef int create_fn(void *thread, const void *attr, void *(*fn)(void *), void *arg);

int pthread_create(void *thread, const void *attr, void *(*fn)(void *), void *arg)
{
    static create_fn *real;
    unsigned short own = get_gs();
    unsigned int all[2] = {~0u, ~0u}, old[2];
    struct start *s;
    struct user_desc d;
    int r;

    if (!real) real = (create_fn *)dlsym(RTLD_NEXT, "pthread_create");
    if (!real) return ENOSYS;
    /* Threads of a process whose %gs was never moved need nothing. */
    if (!(own & 4)) return real(thread, attr, fn, arg);
    if (!(s = malloc(sizeof *s))) return 11; /* EAGAIN */
    s->fn = fn;
    s->arg = arg;

    /* Block signals (a signal would reload %gs from the shared entry), and
     * the new thread starts with them blocked until the trampoline has
     * moved its %gs and restored the creator's mask. */
    sys6(SYS_rt_sigprocmask, SIG_SETMASK, (long)all, (long)old, 8, 0, 0);
    s->mask[0] = old[0];
    s->mask[1] = old[1];
    while (__sync_lock_test_and_set(&create_lock, 1))
        ;
    fill_desc(&d, gdt_gs >> 3, gs_base());
    sys(SYS_set_thread_area, &d, 0, 0);
    set_gs(gdt_gs);
    r = real(thread, attr, trampoline, s);
    set_gs(own);
    __sync_lock_release(&create_lock);
    sys6(SYS_rt_sigprocmask, SIG_SETMASK, (long)old, 0, 8, 0, 0);
    if (r != 0) free(s); /* otherwise the trampoline frees it */
    return r;
}
