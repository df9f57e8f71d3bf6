# Encrypted terminal access.
[ssh]
title="SSH"
protocol=tcp
ports=22
forwardable=yes
