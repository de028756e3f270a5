#!/usr/bin/env python3
"""Writes the seed inputs of the fuzz targets into fuzz/corpus/<target>/.

Each seed is a small valid input in the framing its target reads (see the
comment at the top of each fuzz/*_fuzzer.cpp).  Run from anywhere; the files
are rewritten whole.
"""
import os
import struct

HERE = os.path.dirname(os.path.abspath(__file__))


def put(target, name, data):
    d = os.path.join(HERE, 'corpus', target)
    os.makedirs(d, exist_ok=True)
    with open(os.path.join(d, name), 'wb') as f:
        f.write(data)


# ---- tables -------------------------------------------------------------------

def wide(text):
    return b''.join(struct.pack('<I', ord(c)) for c in text)


def compressed(v):
    groups = []
    while True:
        groups.append(v & 0x7f)
        v >>= 7
        if v == 0:
            break
    groups.reverse()
    return bytes(((g << 1) | (1 if i + 1 < len(groups) else 0)) for i, g in enumerate(groups))


def table_hash(key):
    acc = 0
    for c in key + '\0':
        acc = (acc * 37 + ord(c)) & 0xffffffff
    signed = acc - (1 << 32) if acc & 0x80000000 else acc
    r = abs(signed) % 65536
    if signed < 0:
        r = -r
    if r < 0:
        r += 65536
    return r


FIELDS = [('N', 5), ('S', 4), ('A', 3), ('B', 1), ('C', 2)]


def value(kind, v, packed):
    if kind == 1:
        return struct.pack('<B', v)
    if kind == 5:
        raw = v.encode('utf-8')
        return (compressed(len(raw)) if packed else struct.pack('<H', len(raw))) + raw
    if kind == 6:
        return b''
    if packed:
        return compressed(v)
    return struct.pack({2: '<H', 3: '<I', 4: '<Q'}[kind], v)


def table(records, packed, removed=(), fields=FIELDS, nulls=0):
    header = struct.pack('<III', len(records) - len(removed), len(removed), len(fields))
    for name, kind in fields:
        header += struct.pack('<II', kind, len(name) * 4) + wide(name)
    dat = header
    pxx = b''
    bitmap = (len(fields) + 7) // 8
    for i, rec in enumerate(records):
        pxx += struct.pack('<I', 0 if i in removed else len(dat))
        dat += bytes([nulls] * bitmap)
        for (name, kind), v in zip(fields, rec):
            dat += value(kind, v, packed)
    return dat, pxx


def index_list(entries):
    out = b''
    for tag, idx, field in entries:
        out += struct.pack('<II', tag, len(idx) * 4) + wide(idx) + struct.pack('<I', len(field) * 4) + wide(field)
    return out


def table_input(flags, dat, pxx, lst, chain, patches):
    out = struct.pack('<BHHHI', flags, len(dat), len(pxx), len(lst), chain) + dat + pxx + lst
    for slot, rid, nxt in patches:
        out += struct.pack('<III', slot, rid, nxt)
    return out


RECORDS = [('readme.txt', 1200, 7, 1, 300), ('Été.doc', 0, 0xffffffff, 255, 65535),
           ('a' * 300, 2 ** 40, 128, 0, 1)]


def key_patches(records, removed=()):
    patches = []
    used = {}
    for i, rec in enumerate(records):
        b = table_hash(rec[0].upper())
        if b in used:
            continue
        used[b] = i
        patches.append((b, i, 0xffffffff))
    return patches


lst = index_list([(110, 'fzidx', 'N')])
dat, pxx = table(RECORDS, False)
put('table_fuzzer', 'plain_indexed', table_input(0x80, dat, pxx, lst, 65536, key_patches(RECORDS)))
dat, pxx = table(RECORDS, True, removed=(1,))
# A chain of two: bucket of record 0 -> overflow slot 65536 -> record 2.
b0 = table_hash(RECORDS[0][0].upper())
put('table_fuzzer', 'compressed_chain',
    table_input(0x81 | (2 << 1), dat, pxx, lst, 65536, [(b0, 0, 65536), (65536, 2, 0xffffffff)]))
dat, pxx = table(RECORDS[:2], False, nulls=0xff)
put('table_fuzzer', 'plain_no_index', table_input(0x00, dat, pxx, b'', 0, []))
# Enough rows of names of both parities for the filtered walks to pass some
# over inside the table: with a sound index, and compressed with removals.
MANY = [('n' + 'x' * (i % 7) + str(i), i * 13, i, i % 256, i * 7) for i in range(60)]
dat, pxx = table(MANY, False)
put('table_fuzzer', 'many_rows_indexed', table_input(0x80, dat, pxx, lst, 65536, key_patches(MANY)))
dat, pxx = table(MANY, True, removed=(5, 17, 59))
put('table_fuzzer', 'many_rows_compressed', table_input(0x01, dat, pxx, b'', 0, []))
dat, pxx = table([(), ()], False, fields=[])
put('table_fuzzer', 'no_fields', table_input(0x00, dat, pxx, index_list([(7, 'x', 'y')]), 0, []))
dat, pxx = table([('x', 1)], False, fields=[('N', 5), ('H', 6)])
put('table_fuzzer', 'hex_column', table_input(0x00, dat, pxx, b'', 0, []))


# ---- result files -------------------------------------------------------------

def rstring(text):
    raw = text.encode('utf-8')
    return struct.pack('>I', len(raw) + 1) + raw


def result_record(path, name, md5='', sha='', mask=0, values=()):
    out = rstring(path) + rstring(name) + rstring(md5) + rstring(sha) + struct.pack('>I', mask)
    it = iter(values)
    for bit in range(12):
        if mask & (1 << bit):
            out += struct.pack('>Q' if bit == 1 else '>I', next(it))
    return out


full = result_record('/data/', 'report.txt', 'd41d8cd98f00b204e9800998ecf8427e', '', 0xfff,
                     [0x20, 12345, 2049, 100, 1000, 77, 1700000000, 1600000000, 1650000000, 1, 0xdeadbeef, 7])
short = result_record('/', 'a', mask=0x2, values=[5])
long_name = result_record('/srv/' + 'x' * 200 + '/', 'Ünïcödé ✓.txt', mask=0x102, values=[99, 1500000000])
put('resultfile_fuzzer', 'one_full_record', b'\x09' + full)
put('resultfile_fuzzer', 'three_records_sort_by_size', b'\x0c' + full + short + long_name)
put('resultfile_fuzzer', 'sort_by_name_descending', b'\x12' + short + long_name + full)
put('resultfile_fuzzer', 'empty_strings', b'\x00' + result_record('', '', mask=0))


# ---- expressions --------------------------------------------------------------

EXPRESSIONS = [
    b'[SIZE]>1000&&[NAME]=="report.txt"',
    b'([A]==1 || [B]==2) && [C]==3',
    b'(1+2)*3==9&&10/[A]>0',
    b'[NAME]=={"*.txt","*.doc"}&&len(vs)==7',
    b'path([DIRID],[NAME])=="/data/report.txt"',
    b'type([NAME],"x")==1||!([SIZE]<=0)',
    b'pathid==[DIRID]&&vs!="x"',
    b'-[SIZE]<0&&0.5<1',
]
for i, e in enumerate(EXPRESSIONS):
    put('expression_fuzzer', 'expr%d' % i, bytes([i & 1]) + e)


# ---- ex_hash and cat_set -------------------------------------------------------

def ex_record(key, digest):
    raw = key.encode('utf-8')
    return struct.pack('<I', len(raw)) + raw + digest


def cat_record(text):
    return struct.pack('<I', len(text)) + wide(text)


ex = ex_record('', bytes(16)) + ex_record('/home', bytes(range(16))) + ex_record('/data/x', b'\xff' * 16)
cat = cat_record('report.txt') + cat_record('*.doc') + cat_record('')
put('cachefiles_fuzzer', 'both_files', struct.pack('<H', len(ex)) + ex + cat)
put('cachefiles_fuzzer', 'ex_hash_only', struct.pack('<H', len(ex)) + ex)
put('cachefiles_fuzzer', 'cat_set_only', struct.pack('<H', 0) + cat_record('ÄÖÜ.txt') + cat_record('?x*'))


# ---- mount table ---------------------------------------------------------------

put('mounttable_fuzzer', 'typical',
    b'/dev/sda1 / ext4 rw,relatime 0 0\n'
    b'proc /proc proc rw,nosuid 0 0\n'
    b'server:/export /mnt/nfs nfs rw,vers=4 0 0\n'
    b'//host/share /mnt/smb cifs rw 0 0\n')
put('mounttable_fuzzer', 'escaped_and_comments',
    b'# comment\n/dev/sdb1 /media/My\\040Disk vfat rw 0 0\n\ntmpfs /run tmpfs rw 0 0\n')
put('mounttable_fuzzer', 'autofs', b'auto.home /home autofs rw,fd=5 0 0\nsshfs#u@h: /mnt/s fuse rw 0 0\n')


# ---- automounter ----------------------------------------------------------------

SEP = b'\xff'
put('automounter_fuzzer', 'master_and_maps',
    b'/home m0\n/net -hosts\n/misc file:m1\n# comment\n+auto.master\n' + SEP +
    b'alice server:/export/alice\nbob -rw,soft :/local/bob\n*  host:/export/&\n' + SEP +
    b'cd -fstype=iso9660,ro :/dev/cdrom\nsmb ://host/share\n' + SEP)
put('automounter_fuzzer', 'formats',
    b'/a file,sun:m0\n/b yp:auto.b\n/c m2\n' + SEP + b'/abs/key h:/p \\\nnext :/x\n' + SEP + SEP +
    b'k1 \t h2:/q\n')
put('automounter_fuzzer', 'bad_map_line', b'/x m0\n/y m1\n' + SEP + b'lonely\nk h:/p\n' + SEP + b'k :/p\n')


# ---- UTF-8 -----------------------------------------------------------------------

put('utf8_fuzzer', 'ascii', b'\x10plain ascii text')
put('utf8_fuzzer', 'mixed', b'\x40' + 'Été ✓ 𝄞 日本'.encode('utf-8'))
put('utf8_fuzzer', 'truncated', b'\x03' + b'ab\xe2\x9c')
put('utf8_fuzzer', 'wide_words', b'\x81' + struct.pack('<4I', 0x41, 0xe9, 0x1d11e, 0x110000))
