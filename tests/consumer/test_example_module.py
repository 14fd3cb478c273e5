"""test_example_module.py FOLDER: what the module in the folder returns, and that it keeps no memory."""
import ctypes
import grp
import os
import pwd
import sys

sys.dont_write_bytecode = True
sys.path.insert(0, sys.argv[1])
import osutils  # pylint: disable=wrong-import-position,import-error


class Memory(ctypes.Structure):
    """What mallinfo2() returns."""
    _fields_ = [(name, ctypes.c_size_t) for name in (
        "arena", "ordblks", "smblks", "hblks", "hblkhd", "usmblks", "fsmblks", "uordblks", "fordblks", "keepcost")]


def expect(value, expected):
    assert value == expected, f"{value!r}, not {expected!r}"


def allocated():
    mallinfo2 = ctypes.CDLL(None).mallinfo2
    mallinfo2.restype = Memory
    return mallinfo2().uordblks


group = max(grp.getgrall(), key=lambda entry: len(entry.gr_mem))


def call_all():
    expect(osutils.user_home("root"), pwd.getpwnam("root").pw_dir)
    expect(osutils.primary_group("root"), grp.getgrgid(pwd.getpwnam("root").pw_gid).gr_name)
    expect(osutils.primary_group(), grp.getgrgid(pwd.getpwuid(os.getuid()).pw_gid).gr_name)
    expect(osutils.group_members(group.gr_name), group.gr_mem)
    expect(osutils.format_dn("cn = a ; o=\u00e4"), "CN=A,O=\u00e4")


call_all()
for nothing in (osutils.user_home("no such user"), osutils.primary_group("no such user"),
                osutils.group_members("no such group"), osutils.format_dn("")):
    expect(nothing, None)
expect(osutils.equal_dns("cn=a,o=x", "CN=A; O=X"), True)
expect(osutils.equal_dns("cn=a", "cn=b"), False)
expect(osutils.check_file(__file__), osutils.SUCCESS)
expect(osutils.check_file("/"), osutils.CONSTRAINT_VIOLATION)
expect(osutils.check_file("/nonexistent"), osutils.NO_SUCH_OBJECT)
try:
    osutils.check_file("/\0")
except ValueError:
    pass
else:
    raise AssertionError("a null character is accepted")

ROUNDS = 2000
for _ in range(100):
    call_all()
before = allocated()
for _ in range(ROUNDS):
    call_all()
grown = allocated() - before
assert grown < ROUNDS * 16, f"{grown} bytes more after {ROUNDS} rounds"  # a lost block has at least 24
