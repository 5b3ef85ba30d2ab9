#!/usr/bin/python3
"""delay_proxy.py TARGET-PORT ROUND-TRIP-MS: a proxy on loopback that keeps every byte half a round
trip each way. Prints its port. It delays without holding back: what comes in is read at once."""
import asyncio
import sys

TARGET, HALF = int(sys.argv[1]), float(sys.argv[2]) / 2000
CHUNK = 256 * 1024
#: Bytes on the way in one direction; a long line holds that much.
WINDOW = 4 * 1024 * 1024


async def deliver(queue, writer, room):
    loop = asyncio.get_running_loop()
    while True:
        due, data = await queue.get()
        await asyncio.sleep(max(0, due - loop.time()))
        if not data:
            break
        writer.write(data)
        await writer.drain()
        room.release(len(data))
    try:
        writer.write_eof()
    except OSError:
        pass


class Room:
    """Counts the bytes on the way."""

    def __init__(self):
        self.used = 0
        self.changed = asyncio.Event()

    async def take(self, count):
        while self.used > WINDOW:
            self.changed.clear()
            await self.changed.wait()
        self.used += count

    def release(self, count):
        self.used -= count
        self.changed.set()


async def pump(reader, writer):
    loop = asyncio.get_running_loop()
    queue, room = asyncio.Queue(), Room()
    delivery = asyncio.create_task(deliver(queue, writer, room))
    try:
        while True:
            data = await reader.read(CHUNK)
            await room.take(len(data))
            queue.put_nowait((loop.time() + HALF, data))
            if not data:
                break
        await delivery
    except OSError:
        delivery.cancel()


async def serve(reader, writer):
    # The handshake is a round trip of its own.
    await asyncio.sleep(2 * HALF)
    target_reader, target_writer = await asyncio.open_connection("127.0.0.1", TARGET)
    await asyncio.gather(pump(reader, target_writer), pump(target_reader, writer),
                         return_exceptions=True)
    for each in (writer, target_writer):
        each.close()


async def main():
    server = await asyncio.start_server(serve, "127.0.0.1", 0)
    print(server.sockets[0].getsockname()[1], flush=True)
    async with server:
        await server.serve_forever()


asyncio.run(main())
