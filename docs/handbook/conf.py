# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
# Sphinx reads this in the assembled folder. No dates: the same sources make the same pages.
project = "BrenvikMobileHelper"
author = "The BrenvikMobileHelper authors"
html_show_copyright = False
extensions = ["myst_parser"]
myst_enable_extensions = ["deflist"]
myst_heading_anchors = 4
exclude_patterns = ["examples/**"]
html_theme = "furo"
html_title = "BrenvikMobileHelper"
html_copy_source = False
html_show_sourcelink = False
html_last_updated_fmt = None
html_static_path = ["handbook.css"]
html_css_files = ["handbook.css"]
pygments_style = "default"
pygments_dark_style = "github-dark"  # of the dark ones, one whose every colour is readable
highlight_language = "none"
