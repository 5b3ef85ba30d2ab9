#!/usr/bin/python3
"""counting_proxy.py TARGET-PORT REPORT: forwards HTTP/1.1 and counts requests and bytes.

Prints its port. At SIGUSR1 it writes what it counted since the last one into REPORT, as JSON, and
prints a line.
"""
import asyncio
import json
import signal
import sys

TARGET, REPORT = int(sys.argv[1]), sys.argv[2]
count = {}


def reset():
    count.update({"requests": {}, "sent": 0, "received": 0})


def report():
    with open(REPORT, "w") as file:
        json.dump(count, file)
    reset()
    print("written", flush=True)


async def requests(reader, writer):
    """Head by head, so that each is counted; bodies have a length."""
    while True:
        head = await reader.readuntil(b"\r\n\r\n")
        lines = head.split(b"\r\n")
        method = lines[0].split(b" ")[0].decode()
        count["requests"][method] = count["requests"].get(method, 0) + 1
        left = 0
        for line in lines[1:]:
            if line.lower().startswith(b"content-length:"):
                left = int(line.split(b":")[1])
        count["sent"] += len(head) + left
        writer.write(head)
        while left > 0:
            data = await reader.read(min(left, 65536))
            if not data:
                return
            left -= len(data)
            writer.write(data)
            await writer.drain()


async def answers(reader, writer):
    while data := await reader.read(65536):
        count["received"] += len(data)
        writer.write(data)
        await writer.drain()


async def serve(reader, writer):
    target_reader, target_writer = await asyncio.open_connection("127.0.0.1", TARGET)
    done, waiting = await asyncio.wait(
        [asyncio.create_task(requests(reader, target_writer)),
         asyncio.create_task(answers(target_reader, writer))],
        return_when=asyncio.FIRST_COMPLETED)
    for task in waiting:
        task.cancel()
    for task in done:
        task.exception()
    writer.close()
    target_writer.close()


async def main():
    reset()
    asyncio.get_running_loop().add_signal_handler(signal.SIGUSR1, report)
    server = await asyncio.start_server(serve, "127.0.0.1", 0)
    print(server.sockets[0].getsockname()[1], flush=True)
    async with server:
        await server.serve_forever()


asyncio.run(main())
