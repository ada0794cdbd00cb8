# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What bvhelperctl and brenvik-standin print with --json, held to the schema that is installed."""
import json
import pathlib

import jsonschema

SCHEMA = json.loads((pathlib.Path(__file__).parents[1] / "schemas" / "bvhelperctl.schema.json").read_text())
SHARED = {"value", "bytes", "notes", "databases", "toldValues", "parameters", "failure", "help", "version"}


def commands():
    """The words of every command that the schema knows."""
    return set(SCHEMA["$defs"]) - SHARED


def validator(name=None):
    where = {**SCHEMA, "anyOf": [{"$ref": "#/$defs/" + name.replace(" ", "%20")}]} if name else SCHEMA
    return jsonschema.Draft202012Validator(where)


def kind(line, arguments):
    """The part of the schema that a line must fit."""
    if line.get("ok") is False:
        return "failure"
    for wish in ("help", "version"):
        if f"--{wish}" in arguments:
            return wish
    words = [each for each in arguments if isinstance(each, str)]
    for name in (" ".join(words[:2]), words[0]):
        if name in commands():
            return name
    raise AssertionError(f"no part of the schema is for {arguments}")


def check(line, arguments):
    """Returns the line; raises when it does not fit the schema as a whole, or its command's part."""
    validator().validate(line)
    validator(kind(line, arguments)).validate(line)
    return line
