# SPDX-License-Identifier: Apache-2.0
"""Every request of the Python module, and asyncio, with the daemon of a root: a function that is declared in another form than the
library has it does not come back with what went in. Then the interpreter, which is to be a copy, is replaced as an upgrade does
while a client is connected. usage: commands.py ROOT"""
import asyncio
import datetime
import os
import shutil
import sys
import time

import zorvane
from zorvane import requests

root = sys.argv[1]
values = {"yes": True, "less": -7, "most": 2**64 - 1, "half": 0.5, "text": "café", "bytes": b"\0\1", "list": ["a", 1], "map": {},
          "date": datetime.datetime(2026, 11, 26, 12, tzinfo=datetime.timezone.utc)}
entitlements = {"com.veltra.security.application-groups": ["group.a"], "com.veltra.security.system-groups": ["systemgroup.a"],
                "com.veltra.security.system-container": True}


def expect(error, call, code=0, says=""):
    try:
        call()
    except error as caught:
        assert caught.code == code and str(caught) and says in str(caught), caught
        return
    raise AssertionError(f"no {error}")


with zorvane.Client(root, timeout=20) as client:
    assert client.find(zorvane.DATA_APPLICATION, "org.a", 501) is None
    made = client.create(zorvane.DATA_APPLICATION, "org.a", 501)
    assert client.find(2, "org.a", 501) == zorvane.Container(2, 501, "org.a", made.uuid, made.path, True) and not made.existed
    assert [(one.identifier, one.uuid) for one in client.list(2, 501) if one.identifier == "org.a"] == [("org.a", made.uuid)]
    client.set_info(made, "k", values)
    assert client.info(made, "k") == values == client.metadata(made).info["k"] and client.info(made, "other") is None
    client.replace(made, client.create(2, "org.a", 501, transient=True))
    made = client.create(2, "org.a", 501)
    client.register("org.a", entitlements)
    assert list(client.group_paths("org.a", 501)) == ["group.a"] == client.call(requests.group_identifiers("org.a", 501))
    assert client.system_path("org.a").startswith(root) and list(client.call(requests.system_group_paths("org.a"))) == ["systemgroup.a"]
    expect(zorvane.Refused, lambda: client.call(requests.system_group_path("systemgroup.a", "org.a")), 55)
    expect(zorvane.Error, lambda: client.call(requests.wipe_plugin_data("")))
    for request in (requests.set_protection(made, 1), requests.recreate_structure(made), requests.regenerate_directory(made),
                    requests.wipe(made), requests.register("org.a", None), requests.retry_test(1, 501),
                    requests.stage_for_delete([made]), requests.empty_death_row()):
        assert client.call(request) is None
    expect(zorvane.NotFound, lambda: client.disk_usage(made), 21)
    expect(zorvane.NotFound, lambda: client.delete(2, "org.a", 501), 21)
    assert client.status()["Peer"]["Known"] and zorvane.class_by_name("data-app") == 2 and zorvane.default_user(2, root) == 1
expect(zorvane.Unreachable, lambda: zorvane.Client("/nonexistent"))


async def beside():
    async with zorvane.AsyncClient(root, timeout=20) as client:
        wanted = [requests.find(2, f"org.{number}", 501, create=True) for number in range(20)]
        given_up = asyncio.ensure_future(client.call(requests.disk_usage(made)))
        await asyncio.sleep(0)
        given_up.cancel()
        found = await asyncio.gather(*map(client.call, wanted))
        assert [one.identifier for one in found] == [f"org.{number}" for number in range(20)]

asyncio.run(beside())

with zorvane.Client(root, timeout=20) as client:
    assert client.find(2, "org.1", 501)
    shutil.copy(sys.executable, sys.executable + ".new")
    os.rename(sys.executable + ".new", sys.executable)
    # The daemon takes notice within a second.
    expect(zorvane.Refused, lambda: [(client.find(2, "org.1", 501), time.sleep(0.05)) for _ in range(100)],
           says="its executable was replaced while it ran")
