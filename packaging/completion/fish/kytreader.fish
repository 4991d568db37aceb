# fish completion for kytreader.
complete -c kytreader -f
complete -c kytreader -s h -l help -d 'Print help and exit'
complete -c kytreader -l version -d 'Print the version and exit'
complete -c kytreader -l server -x -d 'A server of the log'
complete -c kytreader -l stream -x -d 'The stream that the receivers fill'
complete -c kytreader -l durable -x -d 'The name of the consumer'
complete -c kytreader -l batch -x -d 'Posts in one transaction'
complete -c kytreader -l acknowledge-within -x -d 'Seconds until the log gives them out again'
complete -c kytreader -l database -x -d 'PostgreSQL, as host=… dbname=…'
