// A machine of two processes that share a mapped file, two of whose four pages are dirty.
#pragma once

// alpha (pid 100): text of 2 clean pages, 12 dirty, 4 clean and 3 swapped pages of heap, 2 pages of page
// tables. beta (pid 200): a wired dirty page. Pages have 16 KiB.
inline constexpr char kTwoWorkers[] = R"(host  self_region_heft=0  ledger=other,page_table
process  pid=100  name=alpha  args_path=/usr/bin/alpha  heft=300000  heft_peak=400000  page_table=32768
image  pid=100  path=/usr/bin/alpha  base=0x100000000
segment  pid=100  name=__TEXT  start=0x100000000  size=0x8000
region  pid=100  address=0x100000000  size=0x8000  resident=2  pager=1  share_mode=1  object_id=1
region  pid=100  address=0x100010000  size=0x40000  tag=2  resident=16  dirtied=12  swapped=3  object_id=2
region  pid=100  address=0x110000000  size=0x10000  pager=1  path=/data/file.db  resident=4  dirtied=2  share_mode=4  object_id=0x32  pages=2*9,2*1
process  pid=200  name=beta  flags=0  page_table=0
region  pid=200  address=0x10000  size=0x4000  tag=3  resident=1  dirtied=1  wired=1  object_id=3
region  pid=200  address=0x20000  size=0x10000  pager=1  path=/data/file.db  resident=4  dirtied=2  share_mode=4  object_id=0x32  pages=2*9,2*1
)";
