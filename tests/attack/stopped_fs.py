#!/usr/bin/env python3
"""Runs heft beside processes that depend on a user-space file system whose server has stopped. Every run must end within 15 s,
and what is not stuck must be in its report. Needs root and /dev/fuse.

usage: tests/attack/stopped_fs.py FOLDER-OF-THE-PROGRAMS [SUBJECT...]

Subjects: mapped (maps a file of it, not all of whose pages were read), executed (runs a program that lies on it), arguments (its
command line lies in a page of it), toggled (the same, coming and going), locked (waits for it while it holds the lock of its
address space: whoever reads its maps waits, too)."""
import ctypes, errno, mmap, os, shutil, signal, struct, subprocess, sys, tempfile, time

libc = ctypes.CDLL(None, use_errno=True)
PAGE = mmap.PAGESIZE
LIMIT = 15

# The server: one folder with the files "data" (1 MiB) and "program" (a copy of sleep). Protocol: linux/fuse.h.
DIRECT_IO = 1

class Server:
    def __init__(self, folder):
        self.files = {2: ('data', bytearray(b'x' * (1 << 20)), 0o100666), 3: ('program', bytearray(open('/bin/sleep', 'rb').read()), 0o100755)}
        self.fd = os.open('/dev/fuse', os.O_RDWR)
        options = f'fd={self.fd},rootmode=40000,user_id=0,group_id=0,allow_other'
        if libc.mount(b'stopped', folder.encode(), b'fuse', 0, options.encode()) != 0:
            raise OSError(ctypes.get_errno(), 'mount')

    def attributes(self, node):
        size, mode = (0, 0o40755) if node == 1 else (len(self.files[node][1]), self.files[node][2])
        return struct.pack('<6Q10I', node, size, size // 512, 0, 0, 0, 0, 0, 0, mode, 1, 0, 0, 0, 4096, 0)

    def answer(self, opcode, node, body):
        """The answer's body, or an error number; None for what has no answer."""
        if opcode in (2, 36, 42): return None  # FORGET, INTERRUPT, BATCH_FORGET
        if opcode == 26: return struct.pack('<IIIIHHIIHHI28x', 7, 31, 1 << 17, 0, 12, 9, 1 << 17, 1, 32, 0, 0)  # INIT
        if opcode == 1:  # LOOKUP
            for found, (name, _, _) in self.files.items():
                if name.encode() == body.rstrip(b'\0'): return struct.pack('<4Q2I', found, 0, 3600, 3600, 0, 0) + self.attributes(found)
            return errno.ENOENT
        if opcode in (3, 4): return struct.pack('<QII', 3600, 0, 0) + self.attributes(node)  # GETATTR, SETATTR
        if opcode in (14, 27):  # OPEN, OPENDIR
            # A file that is opened with O_APPEND is read and written past the page cache.
            return struct.pack('<QII', 0, DIRECT_IO if struct.unpack_from('<I', body)[0] & os.O_APPEND else 0, 0)
        if opcode == 15:  # READ
            _, offset, size = struct.unpack_from('<QQI', body)
            return bytes(self.files[node][1][offset:offset + size])
        if opcode == 16: return struct.pack('<II', struct.unpack_from('<QQI', body)[2], 0)  # WRITE
        if opcode in (18, 25, 29, 20): return b''  # RELEASE, FLUSH, RELEASEDIR, FSYNC
        return errno.ENOSYS

    def serve(self):
        while True:
            try: request = os.read(self.fd, 1 << 18)
            except OSError as problem:
                if problem.errno == errno.ENODEV: os._exit(0)
                continue
            length, opcode, unique, node = struct.unpack_from('<IIQQ', request)
            reply = self.answer(opcode, node, request[40:length])
            if reply is None: continue
            error, reply = (-reply, b'') if isinstance(reply, int) else (0, reply)
            try: os.write(self.fd, struct.pack('<IiQ', 16 + len(reply), error, unique) + reply)
            except OSError: pass

libc.mmap.restype = ctypes.c_void_p
libc.mmap.argtypes = [ctypes.c_void_p, ctypes.c_size_t, ctypes.c_int, ctypes.c_int, ctypes.c_int, ctypes.c_long]
libc.prctl.argtypes = [ctypes.c_int] + [ctypes.c_ulong] * 4
PR_SET_NAME, AT_EXECFN = 15, 31

def argument_page():
    """The last page of the stack: it holds the command line and the path that was executed."""
    vector = open('/proc/self/auxv', 'rb').read()
    return next(value for key, value in struct.iter_unpack('<QQ', vector) if key == AT_EXECFN) & ~(PAGE - 1)

def mapped(folder, ready):
    file = os.open(folder + '/data', os.O_RDWR)
    memory = mmap.mmap(file, 1 << 20)
    memory[0]
    ready(); signal.pause()

def executed(folder, ready):
    ready(); os.execv(folder + '/program', ['program', '1000'])

def arguments(folder, ready):
    libc.mmap(argument_page(), PAGE, 3, 0x11, os.open(folder + '/data', os.O_RDWR), 1 << 19)
    ready(); signal.pause()

def toggled(folder, ready):
    file = os.open(folder + '/data', os.O_RDWR)
    address = argument_page()
    name = ctypes.create_string_buffer(b'scriptlike')  # no name of what it executes
    libc.prctl(PR_SET_NAME, ctypes.addressof(name), 0, 0, 0)
    ready()
    while True:
        libc.mmap(address, PAGE, 3, 0x11, file, 1 << 18)  # of the file, not read yet
        libc.mmap(address, PAGE, 3, 0x32, -1, 0)          # its own
        ctypes.memset(address, 65, 64)

def locked(folder, ready):
    shared = mmap.mmap(os.open(folder + '/data', os.O_RDWR), 1 << 20)
    direct = os.open(folder + '/data', os.O_RDWR | os.O_APPEND)
    shared[0] = 1  # a page that mapping the second descriptor has to write first, under the lock
    ready()
    time.sleep(1)  # until the server has stopped
    libc.mmap(None, PAGE, 1, 2, direct, 0)

SUBJECTS = [mapped, executed, arguments, toggled, locked]

def start(work):
    """A child that runs `work` with a call that tells it is ready; its pid, once it is."""
    reading, writing = os.pipe()
    pid = os.fork()
    if pid == 0:
        os.close(reading)
        try: work(lambda: os.write(writing, b'r'))
        finally: os._exit(1)
    os.close(writing)
    os.read(reading, 1)
    os.close(reading)
    return pid

def runs(subject, bystander, folder, tries):
    yield ['heft', '-a'], True
    yield ['heft', str(bystander)], True
    yield ['heft', 'no-such-name', str(bystander)], True
    yield ['heft', '-v', str(subject)], False
    for _ in range(tries): yield ['heft', str(subject)], False
    yield ['heft-record', 'machine', folder + '/capture'], False

def attempt(programs, work):
    folder, scratch = tempfile.mkdtemp(), tempfile.mkdtemp()
    server_process = start(lambda ready: (lambda server: (ready(), server.serve()))(Server(folder)))
    bystander = subprocess.Popen(['/bin/sleep', '1000'])
    subject = start(lambda ready: work(folder, ready))
    failures, previous = 0, None
    try:
        time.sleep(0.3)
        os.kill(server_process, signal.SIGSTOP)
        time.sleep(1.5)
        for words, tells_bystander in runs(subject, bystander.pid, scratch, 300 if work is toggled else 0):
            begun = time.monotonic()
            child = subprocess.Popen([os.path.join(programs, words[0]), *words[1:]], stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
            try: out, err = child.communicate(timeout=LIMIT)
            except subprocess.TimeoutExpired:
                print(f'{work.__name__}: {" ".join(words)}: STILL RUNNING after {LIMIT} s')
                failures += 1
                child.kill()
                if words == previous: break
                continue
            told = not tells_bystander or f'[{bystander.pid}]' in out
            failures += not told
            note = [line for line in err.splitlines() if 'not answering' in line or 'timed out' in line]
            if words == previous: continue
            previous = words
            print(f'{work.__name__}: {" ".join(words[:2])}: status {child.returncode}, {time.monotonic() - begun:.1f} s'
                  + ('' if told else ', the bystander is MISSING') + (f' ({note[0].strip()})' if note else ''))
    finally:
        os.kill(server_process, signal.SIGKILL)  # the kernel then fails what waits
        for pid in (subject, server_process):
            try: os.kill(pid, signal.SIGKILL)
            except ProcessLookupError: pass
            os.waitpid(pid, 0)
        bystander.kill(); bystander.wait()
        libc.umount2(folder.encode(), 2)
        shutil.rmtree(scratch)
        os.rmdir(folder)
    return failures

def main():
    if len(sys.argv) < 2: sys.exit(__doc__)
    chosen = [work for work in SUBJECTS if not sys.argv[2:] or work.__name__ in sys.argv[2:]]
    failures = sum(attempt(sys.argv[1], work) for work in chosen)
    print('every run ended in time' if failures == 0 else f'{failures} runs failed')
    sys.exit(failures > 0)

main()
