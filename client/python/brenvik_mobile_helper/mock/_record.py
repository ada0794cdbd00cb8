# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Writes what a real helper did as a script that does the same."""
import base64
import json
import plistlib
from time import monotonic

from .. import _wire
from .._listener import CivicInfo, Event, LocalAddress
from .._routine import Routine
from ._script import Rule

# The routine whose answer comes later, by the kind of event.
_ASKED_BY = {CivicInfo: "RequestCountryCodeFromLocation", LocalAddress: "RequestWanIPFromLocation"}
_HEAD = """# Recorded by brenvik-mobile-helper-mock. Each rule serves one request, in the order they came; take out "times 1" of the
# last one of its kind to have it serve all that follow.
"""


def json_of(region: bytes | None) -> str | None:
    """A property list as JSON, or None when JSON cannot hold it."""
    if region is None:
        return "null"
    try:
        value = plistlib.loads(region)
        text = json.dumps(value, ensure_ascii=False, allow_nan=False)
        text.encode()
        return text if plistlib.dumps(json.loads(text)) == plistlib.dumps(value) else None
    except Exception:  # the parser has many of its own; whatever it is, the bytes are recorded instead
        return None


def _text(value: str) -> str:
    return json.dumps(value, ensure_ascii=False)


class Entry:
    """A request that was asked: its rule as it stands in the script."""

    def __init__(self, lines: list[str]):
        self.lines = lines
        self.outcome = ""  # none yet
        self.pushes: list[str] = []
        self.begun = monotonic()

    @property
    def text(self) -> str:
        return "\n".join(["", *self.lines, f"  {self.outcome}", *self.pushes, ""])


class Recorder:
    """Keeps the file complete after each request, so that nothing is lost when the mock is killed."""

    def __init__(self, path: str):
        self._file = open(path, "w", encoding="utf-8")
        self._finished: list[Entry] = []
        self._latest: dict[str, Entry] = {}  # the last request of a routine
        self._file.write(_HEAD)
        self._file.flush()

    def close(self) -> None:
        self._file.close()

    def begin(self, routine: Routine, arguments: dict) -> Entry:
        """To be called before the helper is asked, whose push may come before its answer."""
        words, remarks = [f"on {routine.name}"], []
        for each in routine.parameters:
            value = arguments[each.name]
            condition: str | None
            if each.type == "region":
                condition = json_of(value or None)
            elif each.type == "text":
                condition = _text(value)
                try:
                    condition.encode()
                except UnicodeEncodeError:
                    condition = None
            else:
                condition = json.dumps(value)
            if condition is None:
                remarks.append(f"  # {each.name} has no form in JSON, so any is taken")
            else:
                words.append(f"{each.name}={condition}")
        entry = self._latest[routine.name] = Entry([" ".join(words), *remarks, "  times 1"])
        return entry

    def finish(self, entry: Entry, routine: Routine, rule: Rule) -> None:
        entry.outcome = self._outcome(routine, rule)
        self._finished.append(entry)
        self._file.write(entry.text)
        self._file.flush()

    @staticmethod
    def _outcome(routine: Routine, rule: Rule) -> str:
        if rule.outcome != "answer":
            return f"{rule.outcome} {rule.value}" if rule.outcome == "fail" else rule.outcome
        if routine.reply == "status":
            return "answer"
        if routine.reply != "region":
            return "answer " + (json.dumps(rule.value) if routine.reply == "boolean" else _text(rule.value))
        value = json_of(rule.value)
        if value is None:
            return f'answer bytes "{base64.b64encode(rule.value).decode()}"'
        return f"answer {value}"

    def add_event(self, event: Event) -> None:
        """A push goes to the last request that asked for it."""
        asked = self._latest.get(_ASKED_BY.get(type(event), "CheckLASDUpdate"))
        if asked is None:
            return  # somebody else's
        after = int((monotonic() - asked.begun) * 1000)
        if type(event) in _ASKED_BY:
            word = "push civic-info" if isinstance(event, CivicInfo) else "push local-address"
            values = "".join(f" {key}={_text(value)}" for key, value in event.values.items() if isinstance(value, str))
            asked.pushes.append(f"  {word}{values} after {after}")
        else:
            kind = str(event.values.get("Notification")).rpartition(".")[2]
            database = event.values.get("DBType")
            asked.pushes.append(f"  notify {kind}{f' {database}' if database else ''} after {after}")
        if not asked.outcome:
            return
        self._file.seek(0)
        self._file.truncate()
        self._file.write(_HEAD + "".join(each.text for each in self._finished))
        self._file.flush()


__all__ = ["Recorder", "json_of"]
