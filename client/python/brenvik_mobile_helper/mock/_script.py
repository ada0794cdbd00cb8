# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The mock's script: its words, and what they mean."""
import base64
import binascii
import json
import plistlib
import re
from typing import Any

from .. import _wire
from .._errors import InvalidArgumentError
from .._routine import Argument, Routine
from .._table import DATABASES, NOTIFICATION_KINDS, PUSH_KEYS, ROUTINES

PUSHES = {"civic-info": "SetCivicInfoBasedOnCurrentLocation", "local-address": "SetLocalRoutableAddress"}
KINDS = {each.rpartition(".")[2]: each for each in NOTIFICATION_KINDS}
_SPACE = re.compile(r"[ \t]*(?:#.*)?")
_WORD = re.compile(r"[A-Za-z*][A-Za-z0-9_*-]*(?=[\s=~#]|$)")
_NUMBER = re.compile(r"-?\d+(?=\s|#|$)")
_JSON = json.JSONDecoder(parse_constant=lambda word: float("nan") if word == "NaN" else float(word.replace("Infinity", "inf")))


class ScriptError(Exception):
    """A mistake in a script: in which line, and what."""

    def __init__(self, line: int, reason: str):
        self.line = line
        self.reason = reason
        super().__init__(f"line {line}: {reason}")


class Condition:
    """What an argument must be."""

    def __init__(self, argument: Argument, value, pattern: "re.Pattern | None"):
        self.argument, self.value, self.pattern = argument, value, pattern

    def holds(self, given) -> bool:
        if self.argument.type == "region":
            try:
                given = _wire.parsed(given)
            except _wire.ProtocolError:
                return False
        if self.pattern is not None:
            return self.pattern.fullmatch(given) is not None
        return given == self.value and isinstance(given, bool) == isinstance(self.value, bool)


class Push:
    """What is sent to the telephony daemon's services: `name` is a push's or None for a notification."""

    def __init__(self, name: str | None, values: dict, delay: float = 0.0):
        self.name, self.values, self.delay = name, values, delay


class Rule:
    """What becomes of a request. `outcome` is "answer", "fail", "close", "unread", "silence" or "send"."""

    def __init__(self, line: int, routine: Routine | None):
        self.line, self.routine = line, routine
        self.conditions: list[Condition] = []
        self.times: int | None = None
        self.delay = 0.0
        self.outcome = ""
        self.value: Any = None  # of an answer: as read_reply gives it; of a failure: the code; of send: the bytes
        self.in_memory = False
        self.cut: int | None = None
        self.pushes: list[Push] = []
        self.used = 0

    def fits(self, routine: Routine, arguments: dict) -> bool:
        if self.routine is not None and self.routine is not routine:
            return False
        if self.times is not None and self.used >= self.times:
            return False
        return all(each.holds(arguments[each.argument.name]) for each in self.conditions)


class Script:
    """Rules in their order; the first that fits a request is the one."""

    def __init__(self):
        self.rules: list[Rule] = []
        self.check_ins: list[tuple[str, int, int | None]] = []  # "refuse" or "close", code, how often

    def rule_for(self, routine: Routine, arguments: dict) -> Rule | None:
        for each in self.rules:
            if each.fits(routine, arguments):
                each.used += 1
                return each
        return None

    @property
    def unused(self) -> list[Rule]:
        return [each for each in self.rules if not each.used]


def default_value(routine: Routine):
    """What an answer without a value holds."""
    return {"status": None, "boolean": True, "region": None}.get(routine.reply, "")


class _Line:
    """The words of one line."""

    def __init__(self, number: int, text: str):
        self.number, self.text, self.at = number, text, 0
        self._skip()

    def _skip(self):
        self.at = _SPACE.match(self.text, self.at).end()

    def error(self, reason: str) -> ScriptError:
        return ScriptError(self.number, reason)

    @property
    def is_over(self) -> bool:
        return self.at >= len(self.text)

    @property
    def rest(self) -> str:
        """The next word, whatever it is made of."""
        return self.text[self.at:].split(" ")[0]

    def word(self, what: str) -> str:
        found = _WORD.match(self.text, self.at)
        if not found:
            raise self.error(f"{what} is missing" if self.is_over else f"expected {what}, not {self.rest!r}")
        self.at = found.end()
        self._skip()
        return found[0]

    def peek(self) -> str:
        found = _WORD.match(self.text, self.at)
        return found[0] if found else ""

    def number_(self, what: str, least: int, most: int) -> int:
        found = _NUMBER.match(self.text, self.at)
        if not found:
            raise self.error(f"{what} must be a whole number")
        value = int(found[0])
        if not least <= value <= most:
            raise self.error(f"{what} must be {least} to {most}, not {value}")
        self.at = found.end()
        self._skip()
        return value

    def value(self, what: str):
        if self.is_over:
            raise self.error(f"{what} is missing")
        try:
            value, self.at = _JSON.raw_decode(self.text, self.at)
        except (ValueError, RecursionError) as error:
            reason = error.msg if isinstance(error, json.JSONDecodeError) else str(error)
            at = error.pos if isinstance(error, json.JSONDecodeError) else self.at
            raise self.error(f"{what} is not JSON: {reason} at column {at + 1}") from None
        if self.at < len(self.text) and self.text[self.at] not in " \t#":
            raise self.error(f"expected a blank behind the value, not {self.text[self.at]!r}")
        self._skip()
        return value

    def assignment(self, what: str) -> tuple[str, str]:
        """NAME= or NAME~, and what stands between."""
        found = re.compile(r"([A-Za-z_]+)([=~])").match(self.text, self.at)
        if not found:
            raise self.error(f"expected {what}, not {self.rest!r}")
        self.at = found.end()
        return found[1], found[2]

    def end(self):
        if not self.is_over:
            raise self.error(f"nothing was expected behind this: {self.rest!r}")


def _choice(line: _Line, word: str, choices, what: str) -> str:
    if word in choices:
        return word
    from difflib import get_close_matches
    near = get_close_matches(word, choices, 1)
    raise line.error(f"there is no {what} {word!r}" + (f"; is it {near[0]!r}?" if near else f"; there are {', '.join(choices)}"))


def _parse_on(line: _Line) -> Rule:
    name = line.word("the name of a routine, or *")
    name = name.removeprefix("BVMobileHelper")
    if name == "*":
        line.end()
        return Rule(line.number, None)
    routine = ROUTINES[_choice(line, name, list(ROUTINES), "routine")]
    rule = Rule(line.number, routine)
    arguments = {each.name: each for each in routine.parameters}
    while not line.is_over:
        argument, sign = line.assignment("ARGUMENT=VALUE")
        if not arguments:
            raise line.error(f"{routine.name} has no arguments")
        given = arguments[_choice(line, argument, list(arguments), "argument")]
        if any(each.argument is given for each in rule.conditions):
            raise line.error(f"{argument} is given twice")
        value = line.value(argument)
        pattern = None
        if sign == "~":
            if given.type != "text" or not isinstance(value, str):
                raise line.error(f"{argument}~ wants a regular expression in quotes, for an argument that is a text")
            try:
                pattern = re.compile(value, re.S)
            except re.error as error:
                raise line.error(f"{argument} is no regular expression: {error}") from None
        elif given.type == "text":
            try:
                _wire.text(value if isinstance(value, str) else None, given.size, argument)
            except InvalidArgumentError as error:
                raise line.error(_reason(error)) from None
        elif given.type in ("i32", "f64"):
            if isinstance(value, bool) or not isinstance(value, (int, float) if given.type == "f64" else int):
                raise line.error(f"{argument} must be a number")
        rule.conditions.append(Condition(given, value, pattern))
    return rule


def _reason(error: Exception) -> str:
    return str(error).partition(": ")[2]


def _outcome(line: _Line, rule: Rule, outcome: str):
    if rule.outcome:
        raise line.error(f"this rule has an outcome already: {rule.outcome}")
    rule.outcome = outcome


def _parse_answer(line: _Line, rule: Rule):
    _outcome(line, rule, "answer")
    routine = rule.routine
    if routine is None:
        line.end()  # each routine's own default
        return
    form = routine.reply
    rule.value = default_value(routine)
    if form == "region" and line.peek() == "bytes":
        line.word("bytes")
        try:
            rule.value = base64.b64decode(line.value("the region in base64"), validate=True) or None
        except (binascii.Error, TypeError, ValueError):
            raise line.error("the region must be a text in base64") from None
    elif not line.is_over and line.peek() != "in":
        value = line.value("the answer")
        if form == "status":
            raise line.error(f"an answer of {routine.name} has no value")
        if form == "boolean" and not isinstance(value, bool):
            raise line.error(f"the answer of {routine.name} must be true or false")
        if form.startswith("text"):
            size = int(form[5:])
            if not isinstance(value, str) or len(value.encode("utf-8", "replace")) > size or "\0" in value:
                raise line.error(f"the answer of {routine.name} must be a text of at most {size} bytes")
        if form == "region":
            try:
                value = None if value is None else plistlib.dumps(value)
            except (TypeError, ValueError, OverflowError) as error:
                raise line.error(f"the answer cannot be a property list: {error}") from None
        rule.value = value
    if line.peek() == "in":
        line.word("in")
        _choice(line, line.word("memory"), ["memory"], "way to answer in")
        if form != "region":
            raise line.error(f"the answer of {routine.name} is no region, so it cannot come in memory")
        rule.in_memory = True
    line.end()


def _parse_push(line: _Line, rule: Rule):
    kind = _choice(line, line.word("civic-info or local-address"), list(PUSHES), "push")
    name, values = PUSHES[kind], {}
    delay = 0
    while not line.is_over:
        if line.peek() == "after":
            line.word("after")
            delay = line.number_("the time in milliseconds", 0, 3_600_000)
            line.end()
            break
        key, sign = line.assignment("KEY=TEXT")
        _choice(line, key, list(PUSH_KEYS[name]), "key")
        value = line.value(key)
        if sign != "=" or not isinstance(value, str):
            raise line.error(f"{key} must be a text in quotes")
        values[key] = value
    rule.pushes.append(Push(name, values, delay / 1000))


def _parse_notify(line: _Line, rule: Rule):
    kind = _choice(line, line.word("the kind of a notification"), list(KINDS), "notification")
    values = {"Notification": KINDS[kind]}
    if line.peek() not in ("", "after"):
        values["DBType"] = _choice(line, line.word("a database"), list(DATABASES), "database")
    delay = 0
    if line.peek() == "after":
        line.word("after")
        delay = line.number_("the time in milliseconds", 0, 3_600_000)
    line.end()
    rule.pushes.append(Push(None, values, delay / 1000))


def _parse_check_in(line: _Line, script: Script):
    how = _choice(line, line.word("refuse or close"), ["refuse", "close"], "check-in")
    code = line.number_("the code", -0x80000000, 0x7FFFFFFF) if how == "refuse" else 0
    if how == "refuse" and not code:
        raise line.error("0 is no refusal")
    times = None
    if line.peek() == "times":
        line.word("times")
        times = line.number_("how often", 1, 1_000_000)
    line.end()
    script.check_ins.append((how, code, times))


def _parse_in_rule(line: _Line, rule: Rule, word: str):
    if word == "answer":
        _parse_answer(line, rule)
        return
    if word == "push":
        _parse_push(line, rule)
        return
    if word == "notify":
        _parse_notify(line, rule)
        return
    if word == "times":
        rule.times = line.number_("how often", 1, 1_000_000)
    elif word == "delay":
        rule.delay = line.number_("the delay in milliseconds", 0, 3_600_000) / 1000
    elif word == "fail":
        _outcome(line, rule, "fail")
        rule.value = line.number_("the code", -0x80000000, 0x7FFFFFFF)
        if not rule.value:
            raise line.error("0 is success, no failure")
    elif word == "close":
        _outcome(line, rule, "unread" if line.peek() == "unread" else "close")
        if rule.outcome == "unread":
            line.word("unread")
    elif word == "silence":
        _outcome(line, rule, "silence")
    elif word == "send":
        _outcome(line, rule, "send")
        try:
            rule.value = bytes.fromhex(line.value("the bytes"))
        except (TypeError, ValueError):
            raise line.error("the bytes must be a text of hex digits") from None
        if len(rule.value) > 65536:
            raise line.error("a message has at most 65536 bytes")
    elif word == "cut":
        rule.cut = line.number_("how many bytes", 1, 65536)
    line.end()


_IN_RULE = ["answer", "fail", "close", "silence", "send", "cut", "delay", "times", "push", "notify"]


def parse(text: str) -> Script:
    """Reads a script. ScriptError with its line for the first mistake."""
    script = Script()
    rule: Rule | None = None
    for number, content in enumerate(text.split("\n"), 1):
        line = _Line(number, content.rstrip("\r"))
        if line.is_over:
            continue
        word = line.word("a word of the script")
        if word == "on":
            rule = _parse_on(line)
            script.rules.append(rule)
        elif word == "check-in":
            rule = None
            _parse_check_in(line, script)
        elif word in _IN_RULE:
            if rule is None:
                raise line.error(f"{word!r} belongs to a rule: \"on ROUTINE\" must stand before it")
            _parse_in_rule(line, rule, word)
        else:
            _choice(line, word, ["on", "check-in", *_IN_RULE], "word")
    for each in script.rules:
        each.outcome = each.outcome or "answer"
        if each.outcome == "answer" and each.value is None and each.routine is not None:
            each.value = default_value(each.routine)
        if each.cut is not None and each.outcome not in ("answer", "fail"):
            raise ScriptError(each.line, f"there is no answer to cut when the outcome is {each.outcome}")
    return script
