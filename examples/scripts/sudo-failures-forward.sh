#!/bin/sh
# Follows sudo's lines in the journal and sends one sudo.failure event to tarvod for each
# failed authentication, with the user pam_unix names.
journalctl -f -n 0 -o cat SYSLOG_IDENTIFIER=sudo |
  sed -un 's/^pam_unix(sudo:auth): authentication failure;.* ruser=\([^ ]*\) .*/\1/p' |
  while read -r user; do
    [ -n "$user" ] && tarvodctl send sudo.failure "user=$user"
  done
