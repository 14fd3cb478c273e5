#!/usr/bin/python3
"""homes.py GROUP: the members of a group, each with its home directory."""
import sys

import osutils


def main():
    if len(sys.argv) != 2:
        sys.exit("usage: homes.py GROUP")
    members = osutils.group_members(sys.argv[1])
    if members is None:
        sys.exit(f'homes.py: there is no group "{sys.argv[1]}"')
    for member in members:
        print(member, osutils.user_home(member) or "no such user", sep="\t")


main()
