"""unobservable.txt: the changes that no test can observe, and why."""
import collections
import os
import re

KINDS = {'code', 'comparison', 'condition', 'constant', 'logic', 'statement', 'text'}


def read(path):
    """The reasons by (file, change, line)."""
    reasons = {}
    with open(path) as file:
        for number, line in enumerate(file, 1):
            if line.startswith('#') or not line.strip():
                continue
            fields = [field.strip() for field in line.split(' :: ')]
            if len(fields) != 4 or not all(fields):
                raise ValueError(f'{os.path.basename(path)}:{number}: not FILE :: CHANGE :: LINE :: REASON')
            reasons[tuple(fields[:3])] = fields[3]
    return reasons


def squeezed(text):
    return ' '.join(text.split())


def begins_in(old, line, lines):
    """Whether the text `old`, which may go on in the next lines, begins in one of the lines that read `line`."""
    old = re.sub(r'\.\.\.[0-9a-f]{8}$', '', old)  # of a text that was too long
    following = (squeezed(' '.join(lines[at:at + 100])) for at, each in enumerate(lines) if each == line)
    return any(0 <= text.find(old) < len(line) for text in following)


def mistakes(reasons, project):
    """What is wrong with the entries, one text for each that no change can match."""
    sources = collections.defaultdict(list)
    found = []
    for name, change, line in reasons:
        path = os.path.join(project, name)
        if name not in sources and os.path.isfile(path):
            with open(path, encoding='latin-1') as file:
                sources[name] = [squeezed(each) for each in file]
        kind, _, rest = change.partition(' ')
        old, _, new = rest.partition(' -> ')
        if kind not in KINDS:
            found.append(f'no kind of change: {kind}')
        elif not old or not new:
            found.append(f'not KIND OLD -> NEW: {change}')
        elif line not in sources[name]:
            found.append(f'{name} has no such line: {line}')
        elif not begins_in(old, line, sources[name]):
            found.append(f'not in that line of {name}: {old}')
    return found
