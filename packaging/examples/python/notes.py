#!/usr/bin/python3
# SPDX-License-Identifier: Apache-2.0
"""Finds the container of org.example.notes, makes it when there is none, and counts its own starts in an info value."""

import sys

import zorvane

try:
    with zorvane.Client(sys.argv[1] if len(sys.argv) > 1 else "/") as client:
        notes = client.create(zorvane.DATA_APPLICATION, "org.example.notes")
        stored = client.info(notes, "starts")
        starts = (stored if isinstance(stored, int) else 0) + 1
        client.set_info(notes, "starts", starts)
        print(f"{notes.path}, start {starts}")
except zorvane.Error as error:
    sys.exit(f"notes: {error}\nnotes: {error.advice}")
