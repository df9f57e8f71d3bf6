# Web administration of the server.
[webadmin_http]
title="Web administration (HTTP)"
protocol=tcp
ports=5000
forwardable=yes

[webadmin_https]
title="Web administration (HTTPS)"
protocol=tcp
ports=5001
forwardable=yes
