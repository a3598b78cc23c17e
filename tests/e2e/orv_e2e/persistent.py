"""Persistent searches as python3-ldap makes them."""

import ldap
from ldap.controls.psearch import (CHANGE_TYPES_INT, EntryChangeNotificationControl,
                                   PersistentSearchControl)

from .config_file import dn_key
from .programs import DEADLINE

ADD, DELETE, MODIFY = (CHANGE_TYPES_INT[name] for name in ("add", "delete", "modify"))


class Listener:
    """One persistent search of a client; its notices come in the order in which they were sent."""

    def __init__(self, client, base="cn=configuration", scope=ldap.SCOPE_SUBTREE,
                 filter_text="(objectClass=*)", attributes=None, types=("add", "delete", "modify"),
                 changes_only=True, notifications=True):
        self.client = client
        self.message_id = client.search_ext(
            base, scope, filter_text, attributes,
            serverctrls=[PersistentSearchControl(criticality=True, changeTypes=list(types),
                                                 changesOnly=changes_only,
                                                 returnECs=notifications)])

    def next(self, timeout=DEADLINE):
        """The next entry as (comparable DN, attributes, type of change or None)."""
        kind, data, _, _, _, _ = self.client.result4(
            self.message_id, all=0, timeout=timeout, add_ctrls=1)
        assert kind == ldap.RES_SEARCH_ENTRY, (kind, data)
        dn, attributes, controls = data[0]
        changes = [control.changeType for control in controls
                   if control.controlType == EntryChangeNotificationControl.controlType]
        return dn_key(dn), attributes, changes[0] if changes else None

    def has_heard(self):
        """Whether something has come already; raises what ended the search."""
        return self.client.result4(self.message_id, all=0, timeout=0)[0] is not None

    def result(self):
        """Reads on until the search is over; raises what ended it."""
        while True:
            kind, *_ = self.client.result4(self.message_id, all=0, timeout=DEADLINE, add_ctrls=1)
            if kind == ldap.RES_SEARCH_RESULT:
                return

    def established(self):
        """Waits until the server has the search: it answers a connection's requests in order."""
        self.client.search_s("cn=configuration", ldap.SCOPE_BASE, attrlist=["1.1"])
        return self

    def abandon(self):
        self.client.abandon_ext(self.message_id)
