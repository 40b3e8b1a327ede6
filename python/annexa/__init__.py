"""Annexa for Python: find, ready and talk to application plug-ins through the per-user daemon
axd, and write plug-ins that serve their hosts.

    import annexa

    with annexa.Client() as client:
        for plugin in client.match({"KSExtensionPointName": "Greeting"}):
            client.ready([plugin])
            with plugin.connect() as connection:
                print(connection.send({"name": "world"}))

Values cross in JSON with the library's tags, read and written as Python values: UUIDs are
uuid.UUID, data is bytes, dates are aware datetime objects.
"""

from ._client import Client, Connection, Hold, MatchFlag, PlugIn, Watch
from ._errors import Error, ErrorCode, InvalidArgument, NotFound, Refused, Unreachable
from ._json import Descriptor
from . import plugin

__all__ = [
    "Client", "Connection", "Hold", "MatchFlag", "PlugIn", "Watch",
    "Error", "ErrorCode", "InvalidArgument", "NotFound", "Refused", "Unreachable",
    "Descriptor", "plugin",
]
