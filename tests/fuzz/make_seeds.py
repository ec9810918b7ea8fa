#!/usr/bin/env python3
"""Writes the seed corpora of the fuzz targets (tests/fuzz/corpus/<target>/).

Run from anywhere after changing a seed; the files are committed, so builds never run this.
Each seed is a well-formed input or one of the hostile shapes the tool must survive.
"""
import os
import shutil
import struct

HERE = os.path.dirname(os.path.abspath(__file__))


def write_corpus(target, seeds):
    directory = os.path.join(HERE, "corpus", target)
    shutil.rmtree(directory, ignore_errors=True)
    os.makedirs(directory)
    for name, data in seeds.items():
        with open(os.path.join(directory, name), "wb") as f:
            f.write(data if isinstance(data, bytes) else data.encode())


DATA_LINE = ("/dev/block/bootdevice/by-name/userdata /data ext4 "
             "noatime,nosuid,nodev,barrier=1,data=ordered wait,check,encryptable=footer")
ALL_OPTIONS = ("wait,check,encryptable=/dev/block/meta,forceencrypt=footer,"
               "fileencryption=aes-256-xts:aes-256-heh,forcefdeorfbe=footer,keydirectory=/k,"
               "nonremovable,voldmanaged=sdcard1:auto,voldmanaged=usb:3,voldmanaged=usb,"
               "length=-0x10,recoveryonly,swapprio=-7,zramsize=50%,zramsize=0x1000,"
               "max_comp_streams=8,verifyatboot,verify=/dev/x,verify,avb,noemulatedsd,notrim,"
               "formattable,nofail,latemount,reservedsize=128M,reservedsize=0x10,quota,"
               "eraseblk=8192,eraseblk=6144,logicalblk=4096,defaults,bogus,fileencryption=foo")

write_corpus("fstab_text_fuzz", {
    "device": "# fake device mount table\n" + DATA_LINE + "\n"
              "/dev/block/bootdevice/by-name/system /system ext4 ro,barrier=1 wait,verify\n",
    "all_options": "/dev/a /x ext4 ro,rootcontext=x,remount,bind,rec,unbindable,private,slave,"
                   "shared,defaults,nodiratime,noexec " + ALL_OPTIONS + " # trailing\n",
    "crlf": DATA_LINE.replace(" ", "\t") + "\r\n  # comment\r\n\r\n/dev/b /b vfat rw wait\r\n",
    "nul_bytes": "/dev/a /a ext4 ro wait\n/dev/b\0/b ext4 ro wait\n\0\n/dev/c /c\0 ext4 rw check\n",
    "overlong": "/dev/" + "d" * 3000 + " /" + "m" * 2000 + " ext4 " +
                ",".join("opt%d=%s" % (i, "v" * 20) for i in range(120)) + " " +
                ",".join(["wait", "check"] * 400) + "\n",
    "slotselect": "/dev/block/bootdevice/by-name/system /system ext4 ro wait,slotselect\n",
    "four_columns": "/dev/a /a ext4 ro\n",
    # A "verify=" value, then a line that loses the table.
    "verify_then_bad_line": "/dev/a /a ext4 ro wait,verify=/dev/x\n/dev/b /b ext4 ro\n",
    "comments_only": "# nothing\n   \t\n#/dev/a /a ext4 ro wait\n",
    "no_final_newline": "/dev/a /a ext4 ro wait",
})

write_corpus("option_list_fuzz", {
    # Byte 0 even: the mount option column with an out buffer of (byte 0 >> 1) bytes, 1024 from
    # 64 on. Byte 0 odd: the fs_mgr option column.
    "mount_1024": b"\x80noatime,nosuid,nodev,discard,data=ordered,rootcontext=x,errors=panic",
    "mount_cut_small": b"\x0cdiscard,data=ordered,inode_readahead_blks=8,ro",
    "mount_size_0": b"\x00discard,noatime",
    "mount_size_1": b"\x02discard",
    "mount_overlong": b"\x80" + b",".join(b"unknown_option_%04d" % i for i in range(80)),
    "fs_mgr_all": b"\x01" + ALL_OPTIONS.encode(),
    "fs_mgr_repeated": b"\x01" + b",".join([b"encryptable=a", b"voldmanaged=x:1",
                                            b"verify=/v", b"keydirectory=/k"] * 3),
    "fs_mgr_commas": b"\x01,,,wait,,,check,,fileencryption=ice:,voldmanaged=:,",
    "fs_mgr_cr": b"\x01wait,encryptable=footer\r",
})

write_corpus("cmdline_fuzz", {
    # Key, a line feed, then the command line.
    "duplicate": "hardware\nconsole=ttyS0 androidboot.hardware=abc androidboot.hardware=def\n",
    "two_equals": "mode\nandroidboot.mode=a=b androidboot.mode=\n",
    "no_equals": "hardware\nandroidboot.hardware quiet\n",
    "spaces": "slot\n  androidboot.slot=a\t  androidboot.slot_suffix=_b  \n",
    "dt_dir": "android_dt_dir\nandroidboot.android_dt_dir=/tmp/dt\0x androidboot.x=y\n",
    "empty_key": "\nandroidboot.=v androidboot.\n",
})


def record(name, size, content=b"", terminate=True):
    field = name.encode()[:20]
    field = field + b"\0" * (20 - len(field)) if terminate or len(field) < 20 else field
    return struct.pack("<I20sQQ", 0x654C3146, field, size, 0x5555) + content


def split(stream, piece):
    """A filter seed: byte 0 even, bytes 1-2 the piece size less one."""
    return bytes([0]) + struct.pack("<H", (piece - 1) & 0x1FFF) + stream


def readout(stream, pad=False):
    """An extraction seed: byte 0 odd (bit 1: pad the last unit)."""
    return bytes([3 if pad else 1]) + stream


MESSAGE = b"Kernel panic - not syncing: simulated\n" * 3
NORMAL = (record("dmesg.bin", 100, b"\x11" * 100) + record("RAMDUMP_MSG.txt", len(MESSAGE), MESSAGE)
          + record("ddr.bin", 5000, b"\x22" * 5000) + b"\0" * 40)
HOSTILE = (record("../../../../etc/pwn", 10, b"0123456789")
           + record("RAMDUMP_MSG.txt/../x", 5, b"AAAAA", terminate=False)
           + record("/RAMDUMP_MSG.txt", 3, b"BBB") + record("..", 2, b"CC")
           + record("RAMDUMP_MSG.txt", 6, b"hello\n")
           + record("RAMDUMP_MSG.txt", 2**64 - 1, b"Z" * 300))
seeds = {
    "normal_whole": split(NORMAL, 8192),
    "normal_bytewise": split(NORMAL, 1),
    "normal_odd_pieces": split(NORMAL, 37),
    "normal_readout": readout(NORMAL, pad=True),
    "hostile_names": split(HOSTILE, 41),
    "hostile_readout": readout(HOSTILE),
    "huge_sizes": split(record("a", 2**63) + b"x" * 50, 7),
    "huge_size_wanted": split(record("RAMDUMP_MSG.txt", 2**63 - 1) + b"y" * 50, 13),
    "zero_size_wanted": split(record("RAMDUMP_MSG.txt", 0) + record("b", 1, b"b"), 40),
    "bad_magic": split(b"F1Lf" + b"\0" * 60, 3),
}
# A record header that begins k bytes before the end of the first unit's payload, for k on
# both sides of the 16-byte limit up to which the extraction reassembles it correctly.
for k in (1, 16, 17, 39, 40):
    filler = 4080 - 40 - k
    first = record("filler.bin", filler, b"\x33" * filler)
    seeds["header_split_%d" % k] = readout(first + record("RAMDUMP_MSG.txt", 4, b"msg\n"), pad=True)
write_corpus("dump_stream_fuzz", seeds)
