#!/usr/bin/env python3
"""Takes away what heft writes to or reads from while it does: readers, writers, and heft itself. No run may wait for ever, leave half a
document or a temporary file.

usage: tests/attack/documents.py FOLDER-OF-THE-PROGRAMS"""
import atexit, os, shutil, signal, subprocess, sys, tempfile, time

if len(sys.argv) < 2: sys.exit(__doc__)
programs = os.path.abspath(sys.argv[1])
folder = tempfile.mkdtemp(prefix='heft-documents-')
atexit.register(shutil.rmtree, folder)
os.chdir(folder)
LIMIT = 30
signal.alarm(600)
failures = 0

def check(what, holds, seen=''):
    global failures
    failures += not holds
    print('ok  ' if holds else 'FAIL', what, '' if holds else seen)

def start(name, *words):
    return subprocess.Popen([os.path.join(programs, name), *words], stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

def ended(process):
    """Its status; 'hung' where it had to be killed."""
    try:
        return process.wait(LIMIT)
    except subprocess.TimeoutExpired:
        process.kill()
        process.wait()
        return 'hung'

def write(path, text):
    with open(path, 'w') as file:
        file.write(text)

def machine(processes):
    return 'heft-machine 1\nhost\tself_region_heft=1\tledger=other\n' + ''.join(
        f'process\tpid={pid}\tname=p\nregion\tpid={pid}\taddress=0x4000\tsize=0x4000\tobject_id={pid}\n' for pid in range(101, 101 + processes))

# Ended at any moment: the document is the old one or whole, and alone. Moments are spread over a whole run.
write('machine', machine(20000))
begin = time.time()
ended(start('heft-replay', 'machine', '-a', '-j', 'whole'))
replay = time.time() - begin
begin = time.time()
ended(start('heft-record', 'machine', 'whole.machine'))
record = time.time() - begin
for name, words, whole, length in [('heft-replay', ['machine', '-a', '-j', 'document'], 'whole', replay),
                                   ('heft-record', ['machine', 'document'], None, record)]:
    known = {*os.listdir('.'), 'document'}
    for number in (signal.SIGINT, signal.SIGTERM, signal.SIGHUP):
        statuses = set()
        left = []
        damaged = 0
        for step in range(12):
            write('document', 'old\n')
            process = start(name, *words)
            time.sleep(length * step / 10)
            process.send_signal(number)
            statuses.add(ended(process))
            left += set(os.listdir('.')) - known
            content = open('document').read()
            # An interrupt while gathering gives a partial document, which is marked and whole, too.
            isWhole = content.startswith('{') and content.endswith('}') if whole else content.startswith('heft-machine 1\n') and content.endswith('\n')
            damaged += content != 'old\n' and not isWhole
        check(f'{name} ended by {number.name}: {statuses}', not left and not damaged and statuses <= {0, -number}, (left, damaged))

# Readers that go away, and fifos and devices where a name is meant.
os.mkfifo('fifo')
for name, words in [('heft-replay', ['machine', '-a', '-j', 'fifo']), ('heft-record', ['machine', 'fifo'])]:
    process = start(name, *words)
    with open('fifo') as reader:
        reader.read(1)
    check(f'{name} without its reader', ended(process) == 1)
check('a fifo named like a process', ended(start('heft', 'fifo')) == 1)

# Writers: slow, silent and absent.
process = start('heft-replay', 'fifo', '101')
with open('fifo', 'w') as writer:
    time.sleep(12)
    writer.write(machine(1))
check('a machine that comes late', ended(process) == 0)
check('a machine that never comes', ended(start('heft-replay', 'fifo', '101')) == 1)
process = start('heft-replay', 'fifo', '101')
open('fifo', 'w').close()
check('a machine without a word', ended(process) == 1)

# Sparse files as long as any.
for name, head in [('graph', 'heft-memgraph 1\n'), ('comment', 'heft-memgraph 1\n#'), ('core', '')]:
    write(name, head)
    os.truncate(name, 1 << 40)
    begin = time.time()
    status = ended(start('heft', name))
    check(f'a sparse {name} of 1 TiB: {time.time() - begin:.1f} s', status == 1)
sys.exit(failures != 0)
