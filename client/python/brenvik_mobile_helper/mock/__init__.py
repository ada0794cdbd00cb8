# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A stand-in for the helper, for tests that run without it and without root.

    from brenvik_mobile_helper import Client
    from brenvik_mobile_helper.mock import Mock

    with Mock('on CopyCountryCode\\n  answer "NO"') as mock, Client(mock.path) as client:
        assert client.copy_country_code() == "NO"

The program brenvik-mobile-helper-mock is the same for other languages; docs/mock.md of the project has the script's words.
"""
from ._script import Script, ScriptError, parse
from ._server import Mock

__all__ = ["Mock", "Script", "ScriptError", "parse"]
